add_subdirectory(${CMAKE_CURRENT_LIST_DIR}/dispatch)
