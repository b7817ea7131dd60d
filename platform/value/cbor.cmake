# The wire codec (CBOR), the typed encoding of forms and the typed reads of
# message dictionaries.
target_sources(tn_value PRIVATE
  CborDecoder.cpp
  CborEncoder.cpp
  Utf8.cpp
  MessageValue.cpp
  TypedEncoding.cpp
)
