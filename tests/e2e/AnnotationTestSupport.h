// What the end-to-end tests of the annotation requests share: an
// application with data plug-ins (no executable, so no data container and
// no trust needed) installed into a daemon's root before it starts, the
// requests as a client builds them, and reading the annotation file.

#pragma once

#include <gtest/gtest.h>

#include <chrono>
#include <cstdlib>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include <fmt/format.h>

#include "platform/value/Document.h"
#include "platform/value/UUID.h"
#include "platform/value/Value.h"
#include "tests/platform/bundle/BundleTestSupport.h"
#include "tests/support/DaemonProcess.h"
#include "tests/support/RelayPeer.h"
#include "tests/support/Subprocess.h"

namespace tn::test {

inline const std::string kTnctl = std::string(TENON_BINARY_DIR "/tools/tnctl/tnctl");

// root/opt/tenon/applications/Notes with one data plug-in per name,
// identified "com.example.notes.<name>"; returns the plug-ins' paths.
inline std::vector<std::string> installNotes(const std::string& root, const std::vector<std::string>& names) {
  const std::string app = root + "/opt/tenon/applications/Notes";
  makeBundle(app, R"({"BNBundleIdentifier": "com.example.notes", "BNBundleDisplayName": "Notes"})");
  std::vector<std::string> paths;
  for (const std::string& name : names) {
    paths.push_back(app + "/Support/PlugIns/" + name);
    makeBundle(paths.back(), fmt::format(R"({{"BNBundleIdentifier": "com.example.notes.{}", "BNBundleVersion": "1",
      "XTExtension": {{"XTExtensionPointIdentifier": "com.example.notes-point", "XTExtensionProtocol": "#Data",
                       "XTExtensionAttributes": {{"Kind": "note"}}}}}})",
                                         name));
  }
  return paths;
}

// The UUID the registrar gave the plug-in at `path` (tnctl reads its
// store), waiting up to 10 seconds for it to be registered; nil if never.
inline UUID registeredUUID(const std::string& root, const std::string& path) {
  for (int attempt = 0; attempt < 500; ++attempt) {
    const ProcessResult shown = runProcess({kTnctl, "--json", "registry", "show", path}, {"TENON_ROOT=" + root});
    if (shown.exitStatus == 0) {
      const Result<Value> document = readDocument(shown.out, "registry show", DocumentEncoding::Json);
      if (document.ok()) {
        if (const std::string* text = (*document)["uuid"].string()) return *UUID::parse(*text);
      }
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
  }
  return UUID();
}

inline Value uuidArray(const std::vector<UUID>& uuids) {
  Array array;
  for (const UUID& uuid : uuids) array.emplace_back(uuid);
  return Value(std::move(array));
}

inline Value stringArray(const std::vector<std::string>& strings) {
  Array array;
  for (const std::string& text : strings) array.emplace_back(text);
  return Value(std::move(array));
}

// {"request": "annotate", "version": 3, "annotations": change, "uuids": [...]}
inline Dictionary annotateRequest(Dictionary change, const std::vector<UUID>& uuids) {
  return Dictionary{{"request", "annotate"},
                    {"version", 3u},
                    {"annotations", Value(std::move(change))},
                    {"uuids", uuidArray(uuids)}};
}

inline Dictionary bulkAnnotateRequest(Dictionary annotations) {
  return Dictionary{{"request", "bulk-annotate"}, {"version", 3u}, {"annotations", Value(std::move(annotations))}};
}

// The annotation file's "data", or null when it is missing or does not
// parse (a test that must tell these apart reads the file itself).
inline Value storedAnnotations(const std::string& path) {
  const Result<Value> document = readDocumentFile(path);
  return document.ok() ? (*document)["data"] : Value();
}

// A real tenond on a private root holding the Notes application with one
// data plug-in per name, the plug-ins' paths and UUIDs, and a relay peer of
// the daemon (this process). TENON_ROOT names the root while a test runs.
class NotesDaemonTest : public ::testing::Test {
 protected:
  explicit NotesDaemonTest(std::vector<std::string> names) : names_(std::move(names)) {}

  void SetUp() override {
    ASSERT_TRUE(daemon_.accepting()) << daemon_.log();
    ::setenv("TENON_ROOT", daemon_.root().c_str(), 1);
    for (const std::string& path : paths_) {
      uuids_.push_back(registeredUUID(daemon_.root(), path));
      ASSERT_FALSE(uuids_.back().isNil()) << path << " never registered\n" << daemon_.log();
    }
    peer_ = std::make_unique<RelayPeer>(daemon_.service());
    ASSERT_TRUE(peer_->connected());
  }
  void TearDown() override { ::unsetenv("TENON_ROOT"); }

  const std::vector<std::string> names_;
  std::vector<std::string> paths_;  // before daemon_, which fills it
  DaemonProcess daemon_{tenondBinaryPath(), {},
                        [this](const std::string& root) { paths_ = installNotes(root, names_); }};
  std::vector<UUID> uuids_;
  std::unique_ptr<RelayPeer> peer_;
};

}  // namespace tn::test
