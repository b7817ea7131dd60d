# Rules matching over 10,000 daemon plug-in records (made by
# generate-registry-fixture), and the type hierarchy's hot path.
tenon_benchmark(match_bench SOURCES MatchBench.cpp
  LIBS tnd_plugin tn_registrar_lookup tn_registrar tn_types tn_log)
target_compile_definitions(match_bench PRIVATE
  TENON_FIXTURE_GENERATOR="${CMAKE_CURRENT_SOURCE_DIR}/generate-registry-fixture")

# "match" against a real tenond serving 10,000 plug-ins: every plug-in, one
# plug-in, and the cost per returned plug-in against encoding its form alone.
tenon_benchmark(discovery_bench SOURCES DiscoveryBench.cpp LIBS tn_registrar tn_relay tn_value)
target_compile_definitions(discovery_bench PRIVATE
  TENON_BINARY_DIR="${PROJECT_BINARY_DIR}"
  TENON_FIXTURE_GENERATOR="${CMAKE_CURRENT_SOURCE_DIR}/generate-registry-fixture")
add_dependencies(discovery_bench tenond)
