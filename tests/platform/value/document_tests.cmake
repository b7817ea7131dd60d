# Structured-value documents (XML and JSON), base64 and the atomic file write.
tenon_test(document_test
  SOURCES
    XmlDocumentTest.cpp
    XmlHostileInputTest.cpp
    JsonDocumentTest.cpp
    DocumentFileTest.cpp
    Base64Test.cpp
    AtomicFileTest.cpp
  LIBS tn_value)
