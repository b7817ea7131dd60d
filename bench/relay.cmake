# The relay: a request's round trip against a raw socket echo of the same
# bytes, the same through the client library (to a listener in the process
# and to a real tenond), and throughput over 32 connections.
tenon_benchmark(relay_bench SOURCES RelayBench.cpp LIBS tn_client tn_relay)
target_compile_definitions(relay_bench PRIVATE TENON_BINARY_DIR="${PROJECT_BINARY_DIR}")
add_dependencies(relay_bench tenond)

# Another client's latency while one client floods the daemon.
add_executable(flood_bench FloodBench.cpp)
target_link_libraries(flood_bench PRIVATE tn_relay tn_value)
target_include_directories(flood_bench PRIVATE ${PROJECT_SOURCE_DIR})
target_compile_definitions(flood_bench PRIVATE TENON_BINARY_DIR="${PROJECT_BINARY_DIR}")
add_dependencies(flood_bench tenond)
