# Rules matching over 10,000 daemon plug-in records (made by
# generate-registry-fixture), and the type hierarchy's hot path.
tenon_benchmark(match_bench SOURCES MatchBench.cpp
  LIBS tnd_plugin tn_registrar_lookup tn_registrar tn_types tn_log)
target_compile_definitions(match_bench PRIVATE
  TENON_FIXTURE_GENERATOR="${CMAKE_CURRENT_SOURCE_DIR}/generate-registry-fixture")
