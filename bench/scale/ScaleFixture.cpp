#include "bench/scale/ScaleFixture.h"

#include <stdlib.h>
#include <sys/stat.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>

#include "bench/scale/Failure.h"
#include "platform/registrar/Registrar.h"
#include "platform/value/Document.h"
#include "platform/value/Value.h"

namespace tn::bench {
namespace {

void writeFile(const std::string& path, const std::string& text) {
  std::filesystem::create_directories(std::filesystem::path(path).parent_path());
  std::ofstream out(path);
  out << text;
  if (!out.flush()) fail("cannot write " + path);
}

// The store the daemon opens, made by the registrar from the fixture.
ScaleFixture makeStore(const std::string& root, std::size_t expected) {
  registrar::Registrar::Options options;
  options.watch = false;
  options.locale = "";
  auto opened = registrar::Registrar::open(registrar::RegistrarPaths::forRoot(root), options);
  if (!opened.ok()) fail("the registrar cannot open the fixture: " + opened.error().description());
  ScaleFixture fixture;
  for (const registrar::PlugInPtr& record : (*opened)->installedPlugIns()) {
    fixture.plugIns.push_back(record->uuid());
    fixture.identifiers.push_back(record->identifier());
  }
  if (fixture.plugIns.size() != expected) {
    fail("the registrar lists " + std::to_string(fixture.plugIns.size()) + " plug-ins, not " +
         std::to_string(expected));
  }
  return fixture;
}

// One annotation per plug-in, as an "annotate" of an election and an
// extension value would leave it.
void writeAnnotations(const std::string& root, const std::vector<std::string>& identifiers) {
  Dictionary data;
  data.reserve(identifiers.size());
  int64_t order = 0;
  for (const std::string& identifier : identifiers) {
    data.set(identifier, Value(Dictionary{{"election", Value(1)},
                                          {"extension", Value(Dictionary{{"color", "blue"}, {"order", order++}})}}));
  }
  const Value document(Dictionary{{"version", Value(16)}, {"data", Value(std::move(data))}});
  Result<std::string> text = writeXmlDocument(document);
  if (!text.ok()) fail("cannot encode the annotation file: " + text.error().description());
  writeFile(root + "/var/db/Tenon-Annotations", *text);
}

}  // namespace

ScaleRoot::ScaleRoot() {
  std::string pattern = (std::filesystem::temp_directory_path() / "tenon-scale-bench-XXXXXX").string();
  if (::mkdtemp(pattern.data()) == nullptr) fail("cannot make a private root in the temporary directory");
  path_ = pattern;
  ::setenv("TENON_ROOT", path_.c_str(), 1);
}

ScaleRoot::~ScaleRoot() {
  std::error_code ignored;
  std::filesystem::remove_all(path_, ignored);
}

ScaleFixture makeScaleFixture(const ScaleRoot& root, int applications, int plugInsPerApplication) {
  const std::string command = std::string(TENON_FIXTURE_GENERATOR) + " " + root.path() + " " +
                              std::to_string(applications) + " " + std::to_string(plugInsPerApplication);
  if (std::system(command.c_str()) != 0) fail("generate-registry-fixture failed: " + command);
  ScaleFixture fixture =
      makeStore(root.path(), static_cast<std::size_t>(applications) * static_cast<std::size_t>(plugInsPerApplication));
  writeAnnotations(root.path(), fixture.identifiers);
  return fixture;
}

std::vector<std::string> writeApplication(const std::string& directory, const std::string& identifier,
                                          int plugIns) {
  if (std::filesystem::exists(directory)) fail(directory + " already exists");
  writeFile(directory + "/Info.manifest",
            R"({"BNBundleIdentifier": ")" + identifier + R"(", "BNBundleDisplayName": "New application"})");
  std::vector<std::string> bundles;
  for (int p = 0; p < plugIns; ++p) {
    const std::string bundle = directory + "/Support/PlugIns/PlugIn" + (p < 10 ? "0" : "") + std::to_string(p) + ".tnx";
    writeFile(bundle + "/Info.manifest",
              R"({"BNBundleIdentifier": ")" + identifier + ".plugin" + std::to_string(p) +
                  R"(", "BNBundleVersion": "1.0", "BNBundleDisplayName": "New plug-in", "XTExtension": )"
                  R"({"XTExtensionPointIdentifier": "com.ostrel.thumbnail-provider", "XTExtensionProtocol": "#Data", )"
                  R"("XTExtensionAttributes": {"XTExtensionVersion": "1.0", "Kind": "new"}}})");
    bundles.push_back(bundle);
  }
  return bundles;
}

void writeDaemonConfiguration(const std::string& root, const std::string& json) {
  const std::string path = root + "/etc/tenon/tenond.manifest";
  writeFile(path, json);
  for (const std::string& directory : {root, root + "/etc", root + "/etc/tenon"}) ::chmod(directory.c_str(), 0755);
  ::chmod(path.c_str(), 0644);
}

}  // namespace tn::bench
