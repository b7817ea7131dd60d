# What `cmake --install` puts where (standard directories), the client
# library installed for programs outside this tree, and the Debian package.
#
#   sbin/tenond, bin/tnctl
#   lib/libtenon.so.0                        the client library (one shared object)
#   include/tenon/                           its headers, with installed include paths
#   lib/pkgconfig/tenon.pc, lib/cmake/Tenon/ pkg-config and find_package(Tenon): Tenon::tenon
#   share/tenon/{extension-points,sandbox-profiles}
#   /etc/tenon/entitlements.d/tnctl.manifest tnctl's manager entitlement
#   lib/systemd/{system,user}/, lib/tmpfiles.d/  packaging/systemd (its own CMakeLists.txt)
#   share/man/manN/                          docs/man/*.N
#   share/bash-completion/completions/tnctl
#   share/doc/tenon/                         LICENSE, CHANGELOG.md, README.md

include(GNUInstallDirs)
include(CMakePackageConfigHelpers)
include(${CMAKE_CURRENT_LIST_DIR}/install/PublicHeaderPath.cmake)

# The client's headers and every in-tree header they include: what a host
# program needs to compile against TNDaemonClient. The build fails when one
# of them includes an in-tree header missing here (install/PublicHeader.cmake).
set(TENON_PUBLIC_HEADERS
  libtenon/client/TNDaemonClient.h
  libtenon/client/TNPlugInInstance.h
  platform/dispatch/QueueTarget.h
  platform/dispatch/SerialQueue.h
  platform/relay/AuditToken.h
  platform/relay/Connection.h
  platform/relay/Descriptors.h
  platform/relay/Event.h
  platform/relay/PeerIdentity.h
  platform/relay/UniqueFd.h
  platform/value/Date.h
  platform/value/Error.h
  platform/value/Result.h
  platform/value/URL.h
  platform/value/UUID.h
  platform/value/Value.h
)

function(tenon_add_public_headers)
  set(script ${CMAKE_CURRENT_FUNCTION_LIST_DIR}/install/PublicHeader.cmake)
  # A list cannot cross the command line of a custom command: commas instead.
  string(REPLACE ";" "," public "${TENON_PUBLIC_HEADERS}")
  set(outputs "")
  foreach(header IN LISTS TENON_PUBLIC_HEADERS)
    tenon_public_header_path(${header} installed)
    set(output ${PROJECT_BINARY_DIR}/include/${installed})
    add_custom_command(OUTPUT ${output}
      COMMAND ${CMAKE_COMMAND} -DSOURCE_DIR=${PROJECT_SOURCE_DIR} -DHEADER=${header}
              -DOUTPUT=${output} -DPUBLIC_HEADERS=${public} -P ${script}
      DEPENDS ${PROJECT_SOURCE_DIR}/${header} ${script}
              ${CMAKE_CURRENT_FUNCTION_LIST_DIR}/install/PublicHeaderPath.cmake
      COMMENT "Installed form of ${header}"
      VERBATIM)
    list(APPEND outputs ${output})
  endforeach()
  add_custom_target(tenon_public_headers ALL DEPENDS ${outputs})
endfunction()
tenon_add_public_headers()

# libtenon: the objects of the client and of the platform services its
# headers expose, in one shared object, so that a host links one library
# whatever it calls. What those objects use inside (logging, the sandbox
# check, libsystemd, ...) is linked in privately from the static libraries.
add_library(tenon SHARED
  $<TARGET_OBJECTS:tn_client> $<TARGET_OBJECTS:tn_relay>
  $<TARGET_OBJECTS:tn_value> $<TARGET_OBJECTS:tn_dispatch>)
add_library(Tenon::tenon ALIAS tenon)
add_dependencies(tenon tenon_public_headers)
target_link_libraries(tenon PRIVATE tn_client tn_relay tn_value tn_dispatch PUBLIC fmt::fmt)
# Every symbol resolved when the library is made, not in some host later.
target_link_options(tenon PRIVATE LINKER:--no-undefined)
target_include_directories(tenon INTERFACE
  $<BUILD_INTERFACE:${PROJECT_BINARY_DIR}/include>
  $<INSTALL_INTERFACE:${CMAKE_INSTALL_INCLUDEDIR}>)
target_compile_features(tenon INTERFACE cxx_std_20)
set_target_properties(tenon PROPERTIES
  VERSION ${PROJECT_VERSION} SOVERSION ${PROJECT_VERSION_MAJOR} EXPORT_NAME tenon)

install(TARGETS tenond RUNTIME DESTINATION ${CMAKE_INSTALL_SBINDIR})
install(TARGETS tnctl RUNTIME DESTINATION ${CMAKE_INSTALL_BINDIR})
install(TARGETS tenon EXPORT TenonTargets
  LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR})
install(DIRECTORY ${PROJECT_BINARY_DIR}/include/tenon DESTINATION ${CMAKE_INSTALL_INCLUDEDIR})

set(tenon_cmake_dir ${CMAKE_INSTALL_LIBDIR}/cmake/Tenon)
install(EXPORT TenonTargets NAMESPACE Tenon:: DESTINATION ${tenon_cmake_dir})
configure_package_config_file(${CMAKE_CURRENT_LIST_DIR}/install/TenonConfig.cmake.in
  ${PROJECT_BINARY_DIR}/TenonConfig.cmake INSTALL_DESTINATION ${tenon_cmake_dir})
# Before 1.0 a minor version may change the protocol: same minor or nothing.
write_basic_package_version_file(${PROJECT_BINARY_DIR}/TenonConfigVersion.cmake
  COMPATIBILITY SameMinorVersion)
install(FILES ${PROJECT_BINARY_DIR}/TenonConfig.cmake ${PROJECT_BINARY_DIR}/TenonConfigVersion.cmake
  DESTINATION ${tenon_cmake_dir})
configure_file(${CMAKE_CURRENT_LIST_DIR}/install/tenon.pc.in ${PROJECT_BINARY_DIR}/tenon.pc @ONLY)
install(FILES ${PROJECT_BINARY_DIR}/tenon.pc DESTINATION ${CMAKE_INSTALL_LIBDIR}/pkgconfig)

include(${CMAKE_CURRENT_LIST_DIR}/install/TenonInstallData.cmake)
include(${CMAKE_CURRENT_LIST_DIR}/install/TenonPackage.cmake)
