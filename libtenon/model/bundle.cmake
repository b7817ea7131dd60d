# TNBundle, the view over platform/bundle's bundle objects. Included from this
# folder's CMakeLists.txt.
target_sources(tn_model PRIVATE ${CMAKE_CURRENT_LIST_DIR}/TNBundle.cpp)
target_link_libraries(tn_model PUBLIC tn_bundle PRIVATE tn_log)
