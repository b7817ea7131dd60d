# What clients can make the annotation store keep (the values of "annotate"
# and "bulk-annotate" requests): the saved text must always read back. The
# fuzz build has no daemon library, so the store's two files are built in.
tenon_fuzzer(annotation_store
  SOURCES AnnotationStoreFuzzer.cpp
          ${PROJECT_SOURCE_DIR}/tenond/database/TNDAnnotationStore.cpp
          ${PROJECT_SOURCE_DIR}/tenond/database/AnnotationFileText.cpp
  LIBS tn_paths tn_log tn_value)
