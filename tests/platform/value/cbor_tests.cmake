# The CBOR codec, the typed encoding of forms and the message-value reads.
tenon_test(cbor_test
  SOURCES
    CborTest.cpp
    CborRoundTripTest.cpp
    CborInteropTest.cpp
    LargestAllocation.cpp
    TypedEncodingTest.cpp
    MessageValueTest.cpp
  LIBS tn_value)
