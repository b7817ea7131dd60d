# The relay: a request's round trip against a raw socket echo of the same
# bytes, and throughput over 32 connections.
tenon_benchmark(relay_bench SOURCES RelayBench.cpp LIBS tn_relay)
