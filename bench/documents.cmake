# Reading and writing an annotation-sized document (10,000 plug-ins).
tenon_benchmark(document_bench SOURCES DocumentBench.cpp LIBS tn_value)
