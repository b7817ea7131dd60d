# "ready" of one plug-in against a real tenond (registration with the
# process supervisor included).
tenon_benchmark(ready_bench SOURCES ReadyBench.cpp LIBS tn_registrar tn_relay tn_value)
target_compile_definitions(ready_bench PRIVATE TENON_BINARY_DIR="${PROJECT_BINARY_DIR}"
                           TENON_SOURCE_DIR="${PROJECT_SOURCE_DIR}")
add_dependencies(ready_bench tenond upcase)
