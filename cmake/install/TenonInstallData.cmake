# The files installed beside the programs: data the daemon reads under its
# root, the manual pages, the shell completion and the notices. Manual
# pages are globbed (re-checked at each build), so that a new one is
# installed without a change here.

set(tenon_data_dir ${CMAKE_INSTALL_DATADIR}/tenon)
install(DIRECTORY ${PROJECT_SOURCE_DIR}/examples/extension-points/
  DESTINATION ${tenon_data_dir}/extension-points FILES_MATCHING PATTERN "*.manifest")
install(DIRECTORY ${PROJECT_SOURCE_DIR}/packaging/sandbox-profiles/
  DESTINATION ${tenon_data_dir}/sandbox-profiles FILES_MATCHING PATTERN "*.manifest")

# tnctl's manager entitlement names the installed tnctl; the daemon reads
# entitlements under /etc/tenon whatever the prefix (docs/configuration.md).
set(TNCTL ${CMAKE_INSTALL_FULL_BINDIR}/tnctl)
configure_file(${PROJECT_SOURCE_DIR}/packaging/entitlements.d/tnctl.manifest.in
  ${PROJECT_BINARY_DIR}/packaging/entitlements.d/tnctl.manifest @ONLY)
install(FILES ${PROJECT_BINARY_DIR}/packaging/entitlements.d/tnctl.manifest
  DESTINATION ${CMAKE_INSTALL_FULL_SYSCONFDIR}/tenon/entitlements.d)

# The units (system and user) and their tmpfiles.d entry are installed by
# packaging/systemd/CMakeLists.txt, which makes them from their templates.

file(GLOB tenon_man_pages CONFIGURE_DEPENDS ${PROJECT_SOURCE_DIR}/docs/man/*.[1-8])
foreach(page IN LISTS tenon_man_pages)
  string(REGEX MATCH "[1-8]$" section ${page})
  install(FILES ${page} DESTINATION ${CMAKE_INSTALL_MANDIR}/man${section})
endforeach()

install(FILES ${PROJECT_SOURCE_DIR}/packaging/bash-completion/tnctl
  DESTINATION ${CMAKE_INSTALL_DATADIR}/bash-completion/completions)
install(FILES ${PROJECT_SOURCE_DIR}/LICENSE ${PROJECT_SOURCE_DIR}/CHANGELOG.md ${PROJECT_SOURCE_DIR}/README.md
  DESTINATION ${CMAKE_INSTALL_DATADIR}/doc/tenon)
