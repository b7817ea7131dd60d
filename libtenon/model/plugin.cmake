# The plug-in record (TNPlugInCore), its forms, SDK resolution, localization
# and sandbox extensions. Included from this folder's CMakeLists.txt.
target_sources(tn_model PRIVATE
  ${CMAKE_CURRENT_LIST_DIR}/TNPlugInCore.cpp
  ${CMAKE_CURRENT_LIST_DIR}/PlugInForm.cpp
  ${CMAKE_CURRENT_LIST_DIR}/SDKResolution.cpp
  ${CMAKE_CURRENT_LIST_DIR}/Localization.cpp
  ${CMAKE_CURRENT_LIST_DIR}/TNSandboxExtension.cpp)
target_link_libraries(tn_model PRIVATE tn_log tn_sandbox fmt::fmt)
