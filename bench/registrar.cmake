# The registrar on 10,000 plug-ins in 1,000 applications (made by
# generate-registry-fixture): cold open of the store, rescan of unchanged
# roots, lookup by UUID, listing every plug-in.
tenon_benchmark(registrar_bench SOURCES RegistrarBench.cpp LIBS tn_registrar tn_log)
target_compile_definitions(registrar_bench PRIVATE
  TENON_FIXTURE_GENERATOR="${CMAKE_CURRENT_SOURCE_DIR}/generate-registry-fixture")
