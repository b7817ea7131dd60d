# Lint's checks of plug-in manifests (keys, kinds, spelling, attributes).
tenon_fuzzer(manifest_lint
  SOURCES ManifestLintFuzzer.cpp
          ${PROJECT_SOURCE_DIR}/tools/tnctl/ManifestLint.cpp
          ${PROJECT_SOURCE_DIR}/tools/tnctl/ManifestSchema.cpp
          ${PROJECT_SOURCE_DIR}/tools/tnctl/Spelling.cpp
  LIBS tn_activation tn_bundle tn_value fmt::fmt)
