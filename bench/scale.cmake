# tenond at scale, every figure of docs/performance.md in one run: the
# fixture of 10,000 plug-ins with annotations, "find" latency and throughput
# against a raw socket echo (the load client in bench/scale/), warm restart,
# incremental install, resident memory and idle CPU.
add_executable(scale_bench ScaleBench.cpp scale/EchoServer.cpp scale/FrameClient.cpp scale/LoadClient.cpp
               scale/Placement.cpp scale/ProcessWatch.cpp scale/ScaleFixture.cpp)
target_link_libraries(scale_bench PRIVATE tn_registrar tn_relay tn_value)
target_include_directories(scale_bench PRIVATE ${PROJECT_SOURCE_DIR})
target_compile_definitions(scale_bench PRIVATE
  TENON_BINARY_DIR="${PROJECT_BINARY_DIR}"
  TENON_FIXTURE_GENERATOR="${CMAKE_CURRENT_SOURCE_DIR}/generate-registry-fixture")
add_dependencies(scale_bench tenond)
