# The CBOR decoder: message bodies and the typed encoding of forms.
tenon_fuzzer(cbor_decode SOURCES CborDecodeFuzzer.cpp LIBS tn_value)
