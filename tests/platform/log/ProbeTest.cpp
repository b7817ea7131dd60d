#include <gtest/gtest.h>

#include <cstdint>
#include <cstdio>
#include <limits.h>
#include <link.h>
#include <map>
#include <memory>
#include <sstream>
#include <string>
#include <unistd.h>
#include <vector>

#include "platform/log/Probes.h"

namespace tn::probe {
namespace {

struct ProbeNote {
  std::string name;
  std::uint64_t semaphore = 0;       // link-time address from the note
  std::vector<std::string> arguments;  // e.g. "-4@%edi"
};

std::string runCommand(const std::string& command) {
  std::unique_ptr<FILE, int (*)(FILE*)> pipe(::popen(command.c_str(), "r"), ::pclose);
  if (!pipe) return {};
  std::string output;
  char buffer[4096];
  while (std::size_t got = std::fread(buffer, 1, sizeof buffer, pipe.get())) {
    output.append(buffer, got);
  }
  return output;
}

std::string ownExecutable() {
  char path[PATH_MAX] = {};
  ssize_t length = ::readlink("/proc/self/exe", path, sizeof path - 1);
  return length > 0 ? std::string(path, static_cast<std::size_t>(length)) : std::string();
}

// The stapsdt notes of provider "tenond" in `readelf -n` output, e.g.
//     Provider: tenond
//     Name: client-new
//     Location: 0x..., Base: 0x..., Semaphore: 0x...
//     Arguments: -4@%edi
std::vector<ProbeNote> tenondNotes(const std::string& readelfOutput) {
  std::vector<ProbeNote> notes;
  std::istringstream lines(readelfOutput);
  std::string line;
  bool inTenond = false;
  while (std::getline(lines, line)) {
    auto field = [&](const std::string& key) -> std::optional<std::string> {
      auto at = line.find(key + ": ");
      if (at == std::string::npos) return std::nullopt;
      return line.substr(at + key.size() + 2);
    };
    if (auto provider = field("Provider")) {
      inTenond = *provider == "tenond";
      if (inTenond) notes.emplace_back();
    } else if (!inTenond) {
      continue;
    } else if (auto name = field("Name")) {
      notes.back().name = *name;
    } else if (auto semaphore = field("Semaphore")) {
      notes.back().semaphore = std::stoull(*semaphore, nullptr, 16);
    } else if (auto arguments = field("Arguments")) {
      std::istringstream words(*arguments);
      for (std::string word; words >> word;) notes.back().arguments.push_back(word);
    }
  }
  return notes;
}

// The load bias of the main program: run-time address minus link-time address.
std::uintptr_t programLoadBias() {
  std::uintptr_t bias = 0;
  dl_iterate_phdr(
      [](dl_phdr_info* info, std::size_t, void* result) {
        *static_cast<std::uintptr_t*>(result) = info->dlpi_addr;
        return 1;  // the first object is the program itself
      },
      &bias);
  return bias;
}

struct ExpectedProbe {
  volatile unsigned short* semaphore;
  std::vector<std::string> argumentTypes;  // size and sign, as in "-4@"
};

const std::map<std::string, ExpectedProbe>& expectedProbes() {
  static const std::map<std::string, ExpectedProbe> probes = {
      {"client-new", {&tenond_client_new_semaphore, {"-4@"}}},
      {"client-done", {&tenond_client_done_semaphore, {"-4@"}}},
      {"request-input", {&tenond_request_input_semaphore, {"-4@", "8@"}}},
      {"request", {&tenond_request_semaphore, {"-4@", "8@"}}},
      {"request-output", {&tenond_request_output_semaphore, {"-4@", "8@"}}},
      {"db-load", {&tenond_db_load_semaphore, {"8@", "8@"}}},
      {"discover-raw", {&tenond_discover_raw_semaphore, {"4@"}}},
      {"plugin-add", {&tenond_plugin_add_semaphore, {"8@"}}},
      {"plugin-ready", {&tenond_plugin_ready_semaphore, {"8@"}}},
      {"plugin-remove", {&tenond_plugin_remove_semaphore, {"8@", "1@"}}},
  };
  return probes;
}

// Attaches a "tracer" to every probe whose semaphore is in `on` (by raising
// the semaphore, as tracers do) for the lifetime of the object.
class FakeTracer {
 public:
  explicit FakeTracer(std::vector<volatile unsigned short*> on) : on_(std::move(on)) {
    for (auto* semaphore : on_) *semaphore = static_cast<unsigned short>(*semaphore + 1);
  }
  ~FakeTracer() {
    for (auto* semaphore : on_) *semaphore = static_cast<unsigned short>(*semaphore - 1);
  }
  FakeTracer(const FakeTracer&) = delete;
  FakeTracer& operator=(const FakeTracer&) = delete;

 private:
  std::vector<volatile unsigned short*> on_;
};

// Fires every probe through its macro; counts[name] is incremented each
// time that probe's arguments are evaluated.
void fireAll(std::map<std::string, int>& counts) {
  auto hit = [&](const char* name) {
    ++counts[name];
    return 7;
  };
  TN_PROBE_CLIENT_NEW(hit("client-new"));
  TN_PROBE_CLIENT_DONE(hit("client-done"));
  TN_PROBE_REQUEST_INPUT(hit("request-input"), [] { return std::string("request {}"); });
  TN_PROBE_REQUEST(hit("request"), nullptr);
  int replyCode = 0;
  TN_PROBE_REQUEST_OUTPUT(hit("request-output"),
                          [&, replyCode] { return std::to_string(replyCode); });
  TN_PROBE_DB_LOAD(hit("db-load") ? "TNErrorDomain" : "", std::uint64_t{3});
  TN_PROBE_DISCOVER_RAW(static_cast<unsigned>(hit("discover-raw")));
  TN_PROBE_PLUGIN_ADD(hit("plugin-add") ? "/opt/app/PlugIns/a.tnplugin" : "");
  TN_PROBE_PLUGIN_READY(hit("plugin-ready") ? "6E1F4C2A-0000-4000-8000-000000000001" : "");
  TN_PROBE_PLUGIN_REMOVE(hit("plugin-remove") ? "/opt/app/PlugIns/a.tnplugin" : "", true);
}

TEST(ProbeNotesTest, ExecutableCarriesExactlyTheTenProbesWithSemaphores) {
  std::string executable = ownExecutable();
  ASSERT_FALSE(executable.empty());
  std::string output = runCommand("readelf -n '" + executable + "' 2>&1");
  ASSERT_NE(output.find("stapsdt"), std::string::npos) << output.substr(0, 2000);

  std::vector<ProbeNote> notes = tenondNotes(output);
  ASSERT_EQ(notes.size(), 10u) << output;
  const std::uintptr_t bias = programLoadBias();
  std::map<std::string, int> seen;
  for (const ProbeNote& note : notes) {
    ++seen[note.name];
    auto expected = expectedProbes().find(note.name);
    ASSERT_NE(expected, expectedProbes().end()) << "unexpected probe " << note.name;
    const ExpectedProbe& probe = expected->second;
    EXPECT_NE(note.semaphore, 0u) << note.name;
    EXPECT_EQ(note.semaphore, reinterpret_cast<std::uintptr_t>(probe.semaphore) - bias)
        << note.name << ": the note must point at the probe's own semaphore";
    ASSERT_EQ(note.arguments.size(), probe.argumentTypes.size()) << note.name;
    for (std::size_t i = 0; i < note.arguments.size(); ++i) {
      EXPECT_EQ(note.arguments[i].rfind(probe.argumentTypes[i], 0), 0u)
          << note.name << " argument " << i << ": " << note.arguments[i];
    }
  }
  for (const auto& [name, count] : seen) EXPECT_EQ(count, 1) << name;
}

TEST(ProbeEnabledTest, SemaphoreDrivesTheIsEnabledTestAndDescriptionWork) {
  ASSERT_EQ(tenond_request_input_semaphore, 0);
  EXPECT_FALSE(TN_PROBE_ENABLED(request_input));
  int descriptions = 0;
  auto describe = [&] {
    ++descriptions;
    return std::string("<message>");
  };
  TN_PROBE_REQUEST_INPUT(12, describe);
  TN_PROBE_REQUEST_OUTPUT(12, describe);
  EXPECT_EQ(descriptions, 0);

  {
    FakeTracer tracer({&tenond_request_input_semaphore});
    EXPECT_TRUE(TN_PROBE_ENABLED(request_input));
    EXPECT_FALSE(TN_PROBE_ENABLED(request_output));
    TN_PROBE_REQUEST_INPUT(12, describe);
    TN_PROBE_REQUEST_OUTPUT(12, describe);
    EXPECT_EQ(descriptions, 1);
  }
  EXPECT_FALSE(TN_PROBE_ENABLED(request_input));
  TN_PROBE_REQUEST_INPUT(12, describe);
  EXPECT_EQ(descriptions, 1);
}

TEST(ProbeEnabledTest, EachMacroEvaluatesItsArgumentsOnlyWhenItsOwnProbeIsOn) {
  std::map<std::string, int> counts;
  fireAll(counts);
  EXPECT_TRUE(counts.empty());

  for (const auto& [name, probe] : expectedProbes()) {
    counts.clear();
    {
      FakeTracer tracer({probe.semaphore});
      fireAll(counts);
    }
    EXPECT_EQ(counts, (std::map<std::string, int>{{name, 1}})) << name;
  }

  // With every probe on, every site fires (and nothing crashes at the nop).
  std::vector<volatile unsigned short*> all;
  for (const auto& entry : expectedProbes()) all.push_back(entry.second.semaphore);
  FakeTracer tracer(all);
  counts.clear();
  fireAll(counts);
  EXPECT_EQ(counts.size(), 10u);
}

}  // namespace
}  // namespace tn::probe
