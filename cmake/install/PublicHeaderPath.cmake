# tenon_public_header_path(<repo-relative header> <out-var>): where a header
# of the client library is installed, relative to the include directory.
# The client's own headers sit at the top (tenon/TNDaemonClient.h); those of
# the platform services it exposes keep their service's folder
# (platform/value/Value.h -> tenon/value/Value.h).
function(tenon_public_header_path header out)
  if(header MATCHES "^libtenon/client/([^/]+)$")
    set(${out} "tenon/${CMAKE_MATCH_1}" PARENT_SCOPE)
  elseif(header MATCHES "^(platform|libtenon)/([^/]+/[^/]+)$")
    set(${out} "tenon/${CMAKE_MATCH_2}" PARENT_SCOPE)
  else()
    message(FATAL_ERROR "no installed path for the header ${header}: "
                        "only libtenon/client/* and <platform|libtenon>/<folder>/* are installed")
  endif()
endfunction()
