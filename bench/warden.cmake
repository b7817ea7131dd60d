# The supervisor: a host's start request to the plug-in's first answer.
tenon_benchmark(warden_bench SOURCES WardenBench.cpp LIBS tn_vigil tn_warden tn_relay)
target_compile_definitions(warden_bench PRIVATE TENON_BINARY_DIR="${PROJECT_BINARY_DIR}"
                           TENON_SOURCE_DIR="${PROJECT_SOURCE_DIR}")
add_dependencies(warden_bench upcase)
