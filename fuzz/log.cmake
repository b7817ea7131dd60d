# The escaping of log text, which carries whatever peers send.
tenon_fuzzer(log_escape SOURCES LogEscapeFuzzer.cpp LIBS tn_log)
