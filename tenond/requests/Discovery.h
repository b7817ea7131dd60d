#pragma once

// Discovery: which installed plug-ins one host gets for its rules and
// flags, and why each other one is left out.
//
// "match" runs it over every candidate and answers the forms; "explain"
// runs the same steps for one plug-in and answers every step's verdict. So
// that the two can never disagree, each step is a function that returns
// its verdict with its reason as a value, and the whole run (bundle-relative
// preference, the candidate steps, duplicate reduction, replacement marks)
// is one function, whose trace of a chosen plug-in is what "explain"
// reports.
//
// One Discovery serves one request, on the service queue. It takes a
// snapshot of the holds and of the type hierarchy when it is made, so that
// every candidate is judged against one state of them.

#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <unordered_map>
#include <unordered_set>
#include <vector>

#include "platform/value/UUID.h"
#include "platform/value/Value.h"
#include "tenond/plugin/TNDHost.h"
#include "tenond/plugin/TNDMatchContext.h"
#include "tenond/plugin/TNDPlugIn.h"

namespace tnd {

class TNDServer;

// The bits of "match"'s flags; every other bit is ignored.
enum DiscoveryFlag : uint64_t {
  kDiscoverAllVersions = 0x1,
  kDiscoverDuplicates = 0x4,
  kDiscoverSystemOnly = 0x8,
  kDiscoverAll = 0x200,
};

// One step's answer about one plug-in.
struct StepVerdict {
  std::string step;    // "location", "dedication", "hold", "rules", ...
  bool passed = true;
  std::string reason;  // what decided it, in words a person reads
  tn::Array details;   // for "rules": one {"key", "pattern", "passed"} per entry
};

// What happened to one chosen plug-in in a run (for "explain").
struct DiscoveryTrace {
  std::optional<tn::UUID> subject;
  std::vector<StepVerdict> verdicts;  // as the run met them, in order
  bool offered = false;               // its form is among the results
};

using PlugInPtr = std::shared_ptr<TNDPlugIn>;

class Discovery {
 public:
  struct Request {
    std::shared_ptr<TNDServer> server;
    std::shared_ptr<const TNDHost> host;
    tn::Value rules;       // a dictionary, or null
    uint64_t flags = 0;
    tn::Value exclusions;  // an array of rules dictionaries, or null
    // The user's annotation as a form carries it (Transaction::annotationForForm).
    std::function<tn::Dictionary(const TNDPlugIn&)> annotation;
    bool log = true;       // the run's log lines ("explain" runs quietly)
    uid_t user = 0;        // the requesting client's user: the holds that reach it apply
  };

  explicit Discovery(Request request);

  // The candidates, where the host carries its own copy of a plug-in, with
  // that copy instead of every other installation of its identifier.
  std::vector<PlugInPtr> preferBundleRelative(std::vector<PlugInPtr> candidates,
                                              DiscoveryTrace* trace = nullptr) const;

  // The candidate steps, in the order a run takes them.
  StepVerdict location(const TNDPlugIn& plugIn) const;
  StepVerdict dedication(const TNDPlugIn& plugIn) const;
  StepVerdict hold(const TNDPlugIn& plugIn) const;
  StepVerdict rules(const TNDPlugIn& plugIn) const;
  StepVerdict exclusions(const TNDPlugIn& plugIn) const;
  StepVerdict hostAuthorization(const TNDPlugIn& plugIn) const;

  // Every step for one plug-in, none skipped (what "explain" shows first).
  std::vector<StepVerdict> allSteps(const TNDPlugIn& plugIn) const;

  // One plug-in the host gets: its form is the record's (TNDPlugIn::
  // encodedForm) with this annotation, then these replacement marks
  // ("overrider", "overriding", in the order they were made).
  struct Offer {
    PlugInPtr plugIn;
    tn::Dictionary annotation;
    tn::Dictionary marks;
  };

  // The whole discovery over the candidates: the plug-ins the host gets, in
  // the order they were accepted. With a trace, what happened to
  // trace->subject on the way is recorded (and nothing else changes).
  std::vector<Offer> run(std::vector<PlugInPtr> candidates, DiscoveryTrace* trace = nullptr);

  uint64_t flags() const { return flags_; }

 private:
  struct Result {
    Offer offer;
    std::optional<std::string> identifier;
    bool dropped = false;  // a later duplicate took its place
  };
  struct IdentifierHash {
    std::size_t operator()(const std::optional<std::string>& identifier) const {
      return identifier ? std::hash<std::string>()(*identifier) : 0;
    }
  };

  // The steps a run takes before a candidate is exported; the first that
  // fails (logged as the run logs it) decides.
  std::optional<StepVerdict> firstRefusal(const TNDPlugIn& plugIn) const;
  // Duplicate reduction of a new candidate against the results so far of
  // its identifier (positions in `results`, in the order they came): false
  // when the candidate is dropped; may drop one earlier result.
  bool reduceDuplicates(const TNDPlugIn& plugIn, std::vector<Result>& results,
                        const std::vector<std::size_t>& sameIdentifier, DiscoveryTrace* trace) const;
  bool preferredOver(const TNDPlugIn& plugIn, const TNDPlugIn& theirs) const;
  void markReplacements(std::vector<Result>& results, DiscoveryTrace* trace) const;
  bool discoverAll() const { return (flags_ & kDiscoverAll) != 0; }
  int32_t hostPid() const { return host_->pid(); }

  const std::shared_ptr<TNDServer> server_;
  const std::shared_ptr<const TNDHost> host_;
  const tn::Value rules_;
  const uint64_t flags_;
  const tn::Value exclusions_;
  const std::function<tn::Dictionary(const TNDPlugIn&)> annotation_;
  const bool log_;
  const TNDMatchContext context_;
  std::unordered_set<tn::UUID> held_;  // plug-ins blocked by a hold when the request began
  std::optional<std::string> plugInsPath_;  // the host bundle's "PlugIns" directory
};

}  // namespace tnd
