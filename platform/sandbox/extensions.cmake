# Extension tokens: the per-machine key, the token text, and issuing,
# consuming and releasing. Included from this folder's CMakeLists.txt.
target_sources(tn_sandbox PRIVATE
  ${CMAKE_CURRENT_LIST_DIR}/SandboxKey.cpp
  ${CMAKE_CURRENT_LIST_DIR}/ExtensionToken.cpp
  ${CMAKE_CURRENT_LIST_DIR}/Extensions.cpp)
target_link_libraries(tn_sandbox PUBLIC tn_value PRIVATE tn_paths OpenSSL::Crypto fmt::fmt)
