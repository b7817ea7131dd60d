# The Debian package (`cpack -G DEB` in the build directory): everything
# `cmake --install` installs, under the same prefix. The maintainer scripts
# in packaging/debian enable tenond.socket without starting anything.

set(CPACK_GENERATOR DEB)
set(CPACK_PACKAGE_NAME tenon)
set(CPACK_PACKAGE_VENDOR "The Tenon developers")
set(CPACK_PACKAGE_CONTACT "The Tenon developers <tenon@localhost>")
set(CPACK_PACKAGE_DESCRIPTION_SUMMARY "plug-in registry daemon, client library and command-line tool")
set(CPACK_PACKAGE_DESCRIPTION
  "tenond keeps the registry of the plug-ins that applications carry, tells host\
 programs which plug-ins match their rules and what the user chose, and starts\
 plug-ins in their sandbox. The package holds tenond, tnctl, the client library\
 with its headers, pkg-config file and CMake package, systemd units and manual pages.")
set(CPACK_RESOURCE_FILE_LICENSE ${PROJECT_SOURCE_DIR}/LICENSE)
set(CPACK_PACKAGING_INSTALL_PREFIX ${CMAKE_INSTALL_PREFIX})
# tnctl's entitlement goes to /etc/tenon, outside the prefix: staged with DESTDIR.
set(CPACK_SET_DESTDIR ON)
set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
set(CPACK_DEBIAN_PACKAGE_SECTION admin)
set(CPACK_DEBIAN_PACKAGE_LICENSE MIT)
# Dependencies of the programs and the library, as dpkg-shlibdeps finds them.
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS ON)
set(CPACK_DEBIAN_PACKAGE_SUGGESTS "shared-mime-info, bash-completion")
set(CPACK_DEBIAN_PACKAGE_CONTROL_EXTRA
  ${PROJECT_SOURCE_DIR}/packaging/debian/postinst
  ${PROJECT_SOURCE_DIR}/packaging/debian/prerm
  ${PROJECT_SOURCE_DIR}/packaging/debian/postrm)
set(CPACK_DEBIAN_PACKAGE_CONTROL_STRICT_PERMISSION ON)
# Debugging information stays in the build tree; the package is four times smaller.
set(CPACK_STRIP_FILES ON)
include(CPack)
