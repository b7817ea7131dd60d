# cmake -DSOURCE_DIR=<repo> -DHEADER=<repo-relative header> -DOUTPUT=<file>
#       -DPUBLIC_HEADERS=<;-list of repo-relative headers> -P PublicHeader.cmake
#
# Writes one installed header of the client library: the in-tree header with
# every in-tree include ("platform/value/Value.h") turned into the path it is
# installed under (<tenon/value/Value.h>), so that a program outside the tree
# builds against include/tenon/ alone. An in-tree include of a header that is
# not installed is an error: the installed header would not compile.

cmake_minimum_required(VERSION 3.25)

include(${CMAKE_CURRENT_LIST_DIR}/PublicHeaderPath.cmake)

string(REPLACE "," ";" PUBLIC_HEADERS "${PUBLIC_HEADERS}")
file(READ "${SOURCE_DIR}/${HEADER}" text)
string(REGEX MATCHALL "#[ \t]*include[ \t]*\"[^\"]+\"" directives "${text}")
foreach(directive IN LISTS directives)
  string(REGEX REPLACE "^#[ \t]*include[ \t]*\"([^\"]+)\"$" "\\1" included "${directive}")
  if(NOT included IN_LIST PUBLIC_HEADERS)
    message(FATAL_ERROR "${HEADER} includes \"${included}\", which is not an installed header: "
                        "add it to the client library's public headers or include it only in a source file")
  endif()
  tenon_public_header_path("${included}" installed)
  string(REPLACE "${directive}" "#include <${installed}>" text "${text}")
endforeach()
file(WRITE "${OUTPUT}.tmp" "${text}")
file(COPY_FILE "${OUTPUT}.tmp" "${OUTPUT}" ONLY_IF_DIFFERENT)
file(REMOVE "${OUTPUT}.tmp")
