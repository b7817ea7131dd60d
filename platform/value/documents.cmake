# Structured-value documents (XML in Tenon's vocabulary, JSON) and the
# atomic file write the stores save them with. pugixml and nlohmann_json stay
# private: nothing outside these sources sees either library.
target_sources(tn_value PRIVATE
  AtomicFile.cpp
  Base64.cpp
  Document.cpp
  DocumentInput.cpp
  DocumentUtf8.cpp
  JsonDocumentReader.cpp
  JsonDocumentWriter.cpp
  RealText.cpp
  XmlDocumentReader.cpp
  XmlDocumentWriter.cpp
  XmlPrescan.cpp
)
target_link_libraries(tn_value PRIVATE pugixml::pugixml nlohmann_json::nlohmann_json)
