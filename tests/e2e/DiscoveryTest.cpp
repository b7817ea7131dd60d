// Discovery end to end: "match" and "explain" against the real tenond, with
// the real registrar, the shared MIME database, elections in the annotation
// file, the user's exclusions, and hosts that are real programs (copies of
// tnctl placed inside an application, entitled, sandboxed or not).

#include <gtest/gtest.h>

#include <grp.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <map>
#include <random>
#include <set>

#include "libtenon/client/TNDaemonClient.h"
#include "platform/value/Document.h"
#include "platform/value/TypedEncoding.h"
#include "tests/platform/bundle/BundleTestSupport.h"
#include "tests/support/DaemonProcess.h"
#include "tests/support/RelayPeer.h"
#include "tests/support/SeccompFilter.h"
#include "tests/support/Subprocess.h"
#include "tests/support/TrustedInstall.h"

namespace tn::test {
namespace {

const std::string kTnctl = std::string(TENON_BINARY_DIR "/tools/tnctl/tnctl");

// One plug-in bundle's manifest.
struct PlugInSpec {
  PlugInSpec(std::string identifier_, std::string version_ = "1.0", std::string extra_ = "",
             std::string attributes_ = "")
      : identifier(std::move(identifier_)),
        version(std::move(version_)),
        extra(std::move(extra_)),
        attributes(std::move(attributes_)) {}
  std::string identifier;
  std::string version;
  std::string extra;       // more keys for "XTExtension", e.g. R"(, "Dedicated": true)"
  std::string attributes;  // more keys for "XTExtensionAttributes"
};

std::string manifest(const PlugInSpec& spec) {
  return R"({"BNBundleIdentifier": ")" + spec.identifier + R"(", "BNBundleVersion": ")" + spec.version +
         R"(", "XTExtension": {"XTExtensionPointIdentifier": "com.example.thumbnails",
             "XTExtensionProtocol": "com.example.protocol",
             "XTExtensionAttributes": {"XTExtensionVersion": ")" +
         spec.version + R"(", "Kind": "thumb")" + spec.attributes + "}" + spec.extra + "}}";
}

// An application `name` under the application root `root`, with plug-ins.
std::string writeApplication(const std::string& root, const std::string& name, const std::vector<PlugInSpec>& plugIns) {
  const std::string app = root + "/" + name;
  makeBundle(app, R"({"BNBundleIdentifier": "com.example.app.)" + name + R"("})");
  for (const PlugInSpec& spec : plugIns) {
    makeBundle(app + "/Support/PlugIns/" + spec.identifier + "-" + spec.version + ".tnx", manifest(spec));
  }
  return app;
}

std::string plugInPath(const std::string& app, const PlugInSpec& spec) {
  return app + "/Support/PlugIns/" + spec.identifier + "-" + spec.version + ".tnx";
}

// The discovery world every test of this file shares.
void prepareWorld(const std::string& root) {
  const std::string apps = root + "/opt/tenon/applications";
  const std::string system = root + "/System/Applications";
  // The host application: a copy of tnctl inside it is a host whose bundle
  // holds its own copy of com.example.shared and a dedicated plug-in.
  const std::string viewer = writeApplication(apps, "Viewer", {{"com.example.shared", "1.0"},
                                                              {"com.example.dedicated", "1.0", R"(, "Dedicated": true)"}});
  installFile(kTnctl, root, "opt/tenon/applications/Viewer/bin/tnctl");
  writeApplication(apps, "Other",
                   {{"com.example.version", "1.9"},
                    {"com.example.version", "1.10"},
                    {"com.example.tie", "2.0"},
                    {"com.example.svg", "1.0", "", R"(, "Type": "image/svg+xml")"},
                    {"com.example.replacer", "1.0"},
                    {"com.example.replaced", "1.0"},
                    {"com.example.elect-a", "1.0"},
                    {"com.example.elect-b", "1.0"},
                    {"com.example.elect-c", "1.0"},
                    {"com.example.excluded", "1.0"},
                    {"com.example.demanding", "1.0", R"(, "XTExtensionHostEntitlement": "com.example.host")"}});
  writeFile(plugInPath(apps + "/Other", {"com.example.replacer", "1.0"}) + "/Entitlements.manifest",
            R"({"com.ostrel.developer.replace-plugin": "com.example.replaced"})");
  const std::string systemApp =
      writeApplication(system, "Base", {{"com.example.tie", "2.0"}, {"com.example.shared", "2.0"}});
  // The copy outside the system volume is the newer one: still the system
  // copy must win the tie.
  const auto older = std::filesystem::file_time_type::clock::now() - std::chrono::hours(24);
  std::filesystem::last_write_time(plugInPath(systemApp, {"com.example.tie", "2.0"}), older);
  std::filesystem::last_write_time(plugInPath(systemApp, {"com.example.tie", "2.0"}) + "/Info.manifest", older);

  // The shared MIME database, where the daemon looks for it under the root.
  for (const char* file : {"subclasses", "aliases"}) {
    if (std::filesystem::exists(std::string("/usr/share/mime/") + file)) {
      installFile(std::string("/usr/share/mime/") + file, root, std::string("usr/share/mime/") + file, 0644);
    }
  }
  // Elections, the user's exclusions, and an entitled tnctl for managers.
  writeFile(root + "/var/db/Tenon-Annotations", R"({"version": 16, "data": {
      "com.example.elect-a": {"election": 1}, "com.example.elect-c": {"election": 2}}})");
  writeFile(root + "/var/lib/tenon/prefs/" + std::to_string(::geteuid()) + "/com.ostrel.tenon.userprefs.manifest",
            R"({"exclusions": [{"XTExtensionIdentifier": "com.example.excluded"}]})");
  installFile(kTnctl, root, "usr/bin/tnctl");
  writeFile(root + "/etc/tenon/entitlements.d/tnctl.manifest",
            R"({"executable": ")" + root + R"(/usr/bin/tnctl", "entitlements": {"com.ostrel.private.tenon.manager": true}})");
  trustDirectoriesBetween(root, root + "/var/lib/tenon/prefs/x");
}

class Discovery : public ::testing::Test {
 protected:
  void SetUp() override {
    if (::geteuid() != 0) GTEST_SKIP() << "the entitled tnctl must be root's";
    ASSERT_TRUE(daemon_.accepting()) << daemon_.log();
  }

  std::string viewerTnctl() const { return daemon_.root() + "/opt/tenon/applications/Viewer/bin/tnctl"; }
  std::string entitledTnctl() const { return daemon_.root() + "/usr/bin/tnctl"; }

  // The decoded reply of `tnctl --json <arguments>` run as `program`.
  Value json(const std::string& program, std::vector<std::string> arguments, int expectedStatus = 0) {
    arguments.insert(arguments.begin(), {program, "--json"});
    arguments.insert(arguments.end(), {"--service", daemon_.service()});
    const ProcessResult result = runProcess(arguments, daemon_.environment());
    EXPECT_EQ(result.exitStatus, expectedStatus) << result.err << daemon_.log().substr(0, 2000);
    tn::Result<Value> reply = readDocument(result.out, "tnctl", DocumentEncoding::Json);
    EXPECT_TRUE(reply.ok()) << result.out;
    return reply.ok() ? *reply : Value();
  }

  // identifier@version of every plug-in `program` is offered for the rules.
  std::multiset<std::string> offered(const std::string& program, const std::string& rules,
                                     const std::string& flags = "0") {
    std::multiset<std::string> names;
    const Value reply = json(program, {"match", "--rules", rules, "--flags", flags});
    if (const Array* forms = reply["matches"].array()) {
      for (const Value& form : *forms) {
        const std::string* version = form["version"].string();
        names.insert(*form["identifier"].string() + "@" + (version ? *version : form["version"].description()));
      }
    }
    return names;
  }

  static std::string identifierRule(const std::string& identifier) {
    return R"({"XTExtensionIdentifier": ")" + identifier + R"("})";
  }

  DaemonProcess daemon_{tenondBinaryPath(), {}, prepareWorld};
};

TEST_F(Discovery, TheNewestVersionIsOfferedUnlessTheHostAsksForAll) {
  const std::string rules = identifierRule("com.example.version");
  EXPECT_EQ(offered(kTnctl, rules), (std::multiset<std::string>{"com.example.version@1.10"}));
  EXPECT_EQ(offered(kTnctl, rules, "all-versions"),
            (std::multiset<std::string>{"com.example.version@1.10", "com.example.version@1.9"}));
}

TEST_F(Discovery, ATieGoesToTheSystemCopyAndTheHostsOwnCopyComesFirstOfAll) {
  const Value tie = json(kTnctl, {"match", "--rules", identifierRule("com.example.tie")});
  ASSERT_EQ(tie["matches"].array()->size(), 1u);
  EXPECT_EQ(tie["matches"].array()->at(0)["systemResident"], Value(true)) << "though the other copy is newer";

  // com.example.shared: 2.0 on the system volume; 1.0 inside Viewer, whose
  // own program asks.
  EXPECT_EQ(offered(kTnctl, identifierRule("com.example.shared")),
            (std::multiset<std::string>{"com.example.shared@2.0"}));
  EXPECT_EQ(offered(viewerTnctl(), identifierRule("com.example.shared")),
            (std::multiset<std::string>{"com.example.shared@1.0"}));
}

TEST_F(Discovery, ADedicatedPlugInIsOfferedOnlyToTheHostWhoseBundleHoldsIt) {
  EXPECT_TRUE(offered(kTnctl, identifierRule("com.example.dedicated")).empty());
  EXPECT_EQ(offered(viewerTnctl(), identifierRule("com.example.dedicated")).size(), 1u);
}

TEST_F(Discovery, ElectionsNarrowThroughTheRules) {
  const std::string elections = R"("XTExtensionIdentifier": ["com.example.elect-a", "com.example.elect-b",
                                    "com.example.elect-c"])";
  const auto names = [&](const std::string& election) {
    std::set<std::string> identifiers;
    for (const std::string& name : offered(kTnctl, "{" + elections + R"(, "XTUserElection": )" + election + "}")) {
      identifiers.insert(name.substr(0, name.find('@')));
    }
    return identifiers;
  };
  EXPECT_EQ(names(R"("1")"), (std::set<std::string>{"com.example.elect-a"}));
  EXPECT_EQ(names(R"(["0", "=2"])"), (std::set<std::string>{"com.example.elect-b", "com.example.elect-c"}));
  // ">0" leaves the registry's election filter out; the rules still apply.
  EXPECT_EQ(names(R"(["1", ">0"])"), (std::set<std::string>{"com.example.elect-a", "com.example.elect-c"}));
}

TEST_F(Discovery, TypesConformThroughTheSharedMimeDatabase) {
  if (!std::filesystem::exists("/usr/share/mime/subclasses")) GTEST_SKIP() << "no shared MIME database here";
  EXPECT_EQ(offered(kTnctl, R"({"Type": "?TY-CONFORMS:application/xml"})").size(), 1u);
  EXPECT_EQ(offered(kTnctl, R"({"Type": "?TY-CONFORMS:text/plain"})").size(), 1u) << "XML is text";
  EXPECT_TRUE(offered(kTnctl, R"({"Type": "?TY-CONFORMS:image/png"})").empty());
}

TEST_F(Discovery, ReplacementsMarkBothFormsAndExclusionsHoldEvenForDiscoverAll) {
  const Value reply =
      json(kTnctl, {"match", "--rules", R"({"XTExtensionIdentifier": ["com.example.replacer", "com.example.replaced"]})"});
  std::map<std::string, Value> forms;
  for (const Value& form : *reply["matches"].array()) forms[*form["identifier"].string()] = form;
  ASSERT_EQ(forms.size(), 2u);
  EXPECT_EQ(forms["com.example.replaced"]["overrider"], forms["com.example.replacer"]["uuid"]);
  EXPECT_EQ(forms["com.example.replacer"]["overriding"], Value("com.example.replaced"));

  const std::string rules = R"({"XTExtensionIdentifier": ["com.example.excluded", "com.example.dedicated"]})";
  EXPECT_EQ(offered(entitledTnctl(), rules, "all"),
            (std::multiset<std::string>{"com.example.dedicated@1.0"}))
      << "all skips dedication, not the user's exclusions";
}

TEST_F(Discovery, DiscoverAllIsForUnsandboxedManagersOnly) {
  const std::string refused = "tnctl: error 11: unauthorized discovery flag (TNDiscoverAll)\n";
  const ProcessResult plain = runProcess({kTnctl, "match", "--flags", "all", "--service", daemon_.service()},
                                         daemon_.environment());
  EXPECT_EQ(plain.err, refused);
  ChildProcess sandboxed({entitledTnctl(), "match", "--flags", "0x200", "--service", daemon_.service()},
                         environmentWith(daemon_.environment()), [] { return installAllowAllFilter(); });
  EXPECT_EQ(sandboxed.finish().err, refused);
  ChildProcess unprivileged({entitledTnctl(), "match", "--flags", "all", "--service", daemon_.service()},
                            environmentWith(daemon_.environment()),
                            [] { return ::setgroups(0, nullptr) == 0 && ::setgid(65534) == 0 && ::setuid(65534) == 0; });
  EXPECT_EQ(unprivileged.finish().err, refused);
  EXPECT_FALSE(offered(entitledTnctl(), "{}", "all").empty());
}

TEST_F(Discovery, ExplainSaysWhyAHostIsRefused) {
  const std::string demanding = daemon_.root() + "/opt/tenon/applications/Other/Support/PlugIns/com.example.demanding-1.0.tnx";
  const Value explanation = json(kTnctl, {"explain", "--path", demanding})["explanation"];
  EXPECT_EQ(explanation["offered"], Value(false));
  bool found = false;
  for (const Value& step : *explanation["steps"].array()) {
    if (step["step"] != Value("host authorization")) continue;
    found = true;
    EXPECT_EQ(step["passed"], Value(false));
    EXPECT_EQ(step["reason"], Value("the host does not have the \"com.example.host\" entitlement"));
  }
  EXPECT_TRUE(found);

  const ProcessResult readable =
      runProcess({kTnctl, "explain", "--path", demanding, "--service", daemon_.service()}, daemon_.environment());
  EXPECT_NE(readable.out.find("NOT OFFERED"), std::string::npos) << readable.out;
  EXPECT_NE(readable.out.find("[NO] host authorization"), std::string::npos) << readable.out;
  // Another host, named by its program: only for managers.
  EXPECT_EQ(runProcess({kTnctl, "explain", "--path", demanding, "--host", viewerTnctl(), "--service", daemon_.service()},
                       daemon_.environment())
                .err,
            "tnctl: error 11: explaining for another host requires a manager\n");
  const Value forViewer = json(entitledTnctl(), {"explain", "--path", demanding, "--host", viewerTnctl()});
  EXPECT_EQ(forViewer["explanation"]["host"], Value(viewerTnctl()));
}

// "explain" and "match" must never disagree: over generated rules and flags,
// for several hosts, a plug-in is explained as offered exactly when "match"
// returns it.
namespace agreement {

// Per rule key, the patterns a generated rules dictionary picks from: every
// step of a discovery is reachable (identifiers, versions, attributes, types,
// elections, containing application, entitlements, bad operators).
const std::vector<std::pair<std::string, std::vector<std::string>>> kRulePool = {
    {"XTExtensionIdentifier",
     {R"("com.example.version")", R"(["com.example.tie", "com.example.shared", "com.example.dedicated"])",
      R"("<com.example.f")", R"(["com.example.replacer", "com.example.replaced", "com.example.excluded"])"}},
    {"XTExtensionVersion", {R"(">=2")", R"("<1.10")", R"("<>1.0")"}},
    {"Kind", {R"("thumb")", "true", "false"}},
    {"Type", {R"("?TY-CONFORMS:application/xml")", R"("?TY-IS:image/svg+xml")", R"("?TY-CONFORMS:image/png")"}},
    {"XTUserElection", {R"("1")", R"(["0", "=2"])", R"(["1", ">0"])"}},
    {"XTExtensionContainingApp", {"true", R"("?bogus")"}},
    {"ENTITLEMENT:com.ostrel.developer.replace-plugin", {"true", "false"}},
};
const std::vector<uint64_t> kFlagPool = {0, 0x1, 0x1 | 0x4, 0x8, 0x1 | 0x8, 0x4};

struct Case {
  std::string rules;  // JSON
  uint64_t flags = 0;
};

std::vector<Case> generateCases(unsigned count, unsigned seed) {
  std::mt19937 random(seed);
  std::vector<Case> cases;
  for (unsigned i = 0; i < count; ++i) {
    std::string rules;
    for (const auto& [key, patterns] : kRulePool) {
      if (random() % 3 != 0) continue;
      rules += (rules.empty() ? "" : ", ") + ("\"" + key + "\": ") + patterns[random() % patterns.size()];
    }
    cases.push_back({"{" + rules + "}", kFlagPool[random() % kFlagPool.size()]});
  }
  return cases;
}

// Every plug-in bundle of the discovery world.
std::vector<std::string> worldPlugIns(const std::string& root) {
  std::vector<std::string> paths;
  for (const char* applications : {"/opt/tenon/applications", "/System/Applications"}) {
    for (const auto& application : std::filesystem::directory_iterator(root + applications)) {
      const std::filesystem::path plugIns = application.path() / "Support/PlugIns";
      if (!std::filesystem::is_directory(plugIns)) continue;
      for (const auto& plugIn : std::filesystem::directory_iterator(plugIns)) paths.push_back(plugIn.path().string());
    }
  }
  std::sort(paths.begin(), paths.end());
  return paths;
}

std::string describe(const Case& c) { return c.rules + " flags " + std::to_string(c.flags); }

}  // namespace agreement

TEST_F(Discovery, ExplainAgreesWithMatchOverGeneratedCases) {
  using namespace agreement;
  const std::vector<std::string> plugIns = worldPlugIns(daemon_.root());
  ASSERT_GE(plugIns.size(), 15u);
  ::setenv("TENON_ROOT", daemon_.root().c_str(), 1);
  RelayPeer peer(daemon_.service());
  ::unsetenv("TENON_ROOT");
  ASSERT_TRUE(peer.connected());

  // This test program as the host, in-process: many cases.
  unsigned offeredSomewhere = 0;
  for (const Case& c : generateCases(60, 20261123)) {
    const Value rules = *readDocument(c.rules, "rules", DocumentEncoding::Json);
    const Value matched = peer.request({{"request", "match"}, {"version", 3}, {"rules", rules}, {"flags", c.flags}});
    ASSERT_EQ(matched["errorcode"].uint64().value_or(0), 0u) << describe(c) << matched.description();
    std::set<std::string> uuids;
    const Result<Value> forms = decodeTyped(matched["matches"]);
    ASSERT_TRUE(forms.ok() && forms->isArray()) << describe(c);
    for (const Value& form : *forms->array()) uuids.insert(*form["uuid"].string());
    offeredSomewhere += uuids.empty() ? 0 : 1;
    for (const std::string& path : plugIns) {
      const Value reply = peer.request(
          {{"request", "explain"}, {"version", 3}, {"paths", path}, {"rules", rules}, {"flags", c.flags}});
      const Value& explanation = reply["explanation"];
      ASSERT_TRUE(explanation.isDictionary()) << reply.description();
      EXPECT_EQ(explanation["offered"] == Value(true), uuids.count(*explanation["plugin"].string()) == 1)
          << path << " for " << describe(c);
    }
  }
  EXPECT_GT(offeredSomewhere, 10u) << "the generated cases should offer something often";

  // Hosts that are other programs: one inside an application (its own
  // copies, dedicated plug-ins) and a manager asking for every plug-in.
  struct Host {
    std::string program;
    uint64_t extraFlags;
  };
  for (const Host& host : {Host{viewerTnctl(), 0}, Host{entitledTnctl(), 0x200}}) {
    for (const Case& c : generateCases(4, 7)) {
      const std::string flags = std::to_string(c.flags | host.extraFlags);
      std::set<std::string> uuids;
      const Value matched = json(host.program, {"match", "--rules", c.rules, "--flags", flags});
      if (const Array* forms = matched["matches"].array()) {
        for (const Value& form : *forms) uuids.insert(*form["uuid"].string());
      }
      for (const std::string& path : plugIns) {
        const Value explanation =
            json(host.program, {"explain", "--path", path, "--rules", c.rules, "--flags", flags})["explanation"];
        EXPECT_EQ(explanation["offered"] == Value(true), uuids.count(*explanation["plugin"].string()) == 1)
            << path << " for " << host.program << " " << describe(c);
      }
    }
  }
}

}  // namespace
}  // namespace tn::test
