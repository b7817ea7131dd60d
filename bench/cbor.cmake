# The wire codec: a plug-in-form-sized dictionary through CBOR and through
# the typed encoding.
tenon_benchmark(cbor_bench SOURCES CborBench.cpp LIBS tn_value)
