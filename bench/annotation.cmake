# The annotation requests against a real tenond with 10,000 stored
# annotations: one "annotate" of one plug-in, one "bulk-annotate" of 1,000.
tenon_benchmark(annotation_bench SOURCES AnnotationBench.cpp LIBS tn_registrar tn_relay tn_value)
target_compile_definitions(annotation_bench PRIVATE
  TENON_BINARY_DIR="${PROJECT_BINARY_DIR}"
  TENON_FIXTURE_GENERATOR="${CMAKE_CURRENT_SOURCE_DIR}/generate-registry-fixture")
add_dependencies(annotation_bench tenond)
