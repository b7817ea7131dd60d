# The document readers: each reads arbitrary bytes and, when they are
# accepted, checks that writing and reading again gives the same value.
tenon_fuzzer(xml_document SOURCES XmlDocumentFuzzer.cpp LIBS tn_value)
tenon_fuzzer(json_document SOURCES JsonDocumentFuzzer.cpp LIBS tn_value)
