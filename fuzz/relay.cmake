# The relay's frame reader: arbitrary bytes as they would arrive on a socket.
tenon_fuzzer(relay_frames SOURCES FrameFuzzer.cpp LIBS tn_relay)
