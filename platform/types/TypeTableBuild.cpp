// TypeTableBuilder::build: names interned, aliases resolved, parents linked,
// cycles broken and ancestors closed.

#include <algorithm>
#include <utility>

#include <fmt/format.h>

#include "platform/types/TypeTable.h"

namespace types {
namespace {

constexpr int kMaxAliasHops = 8;

struct Edge {
  uint32_t parent;
  std::string origin;
};

}  // namespace

// The table under construction.
class TypeGraph {
 public:
  TypeGraph(TypeTable& table, std::vector<std::string>& problems) : table_(table), problems_(problems) {}

  // The position of name (interned on first sight), or -1 when the table is
  // full.
  int64_t intern(std::string_view name, const std::string& origin) {
    if (auto known = index().find(name); known != index().end()) return known->second;
    if (names().size() >= TypeTable::kMaxTypes) {
      if (!reportedFull_) problems_.push_back(fmt::format("{}: more than {} types; the rest are ignored", origin,
                                                          TypeTable::kMaxTypes));
      reportedFull_ = true;
      return -1;
    }
    const auto position = static_cast<uint32_t>(names().size());
    names().push_back(foldedTypeName(name));
    index().emplace(names().back(), position);
    parents_.emplace_back();
    return position;
  }

  void link(int64_t child, int64_t parent, const std::string& origin) {
    if (child < 0 || parent < 0) return;
    if (child == parent) {
      problems_.push_back(fmt::format("{}: {} cannot be its own parent; ignored", origin, names()[child]));
      return;
    }
    std::vector<Edge>& edges = parents_[child];
    if (std::any_of(edges.begin(), edges.end(), [&](const Edge& e) { return e.parent == parent; })) return;
    if (edges.size() >= TypeTable::kMaxParents) {
      problems_.push_back(fmt::format("{}: {} has more than {} parents; {} is ignored", origin, names()[child],
                                      TypeTable::kMaxParents, names()[parent]));
      return;
    }
    edges.push_back(Edge{static_cast<uint32_t>(parent), origin});
  }

  void linkImplicitParents() {
    for (size_t child = 0; child < names().size(); ++child) {
      for (std::string_view parent : implicitParents(names()[child])) {
        link(static_cast<int64_t>(child), intern(parent, "implicit"), "implicit");
      }
    }
  }

  // Depth-first from every type in order; a link to a type still on the
  // path closes a cycle and is dropped. Ancestors are closed on the way
  // back, when every parent's are known.
  void closeAncestors() {
    table_.ancestors_.assign(names().size(), {});
    std::vector<uint8_t> state(names().size(), 0);  // 0 new, 1 on the path, 2 done
    for (uint32_t start = 0; start < names().size(); ++start) {
      if (state[start] == 0) walkFrom(start, state);
    }
  }

 private:
  TypeTable::Index& index() { return table_.index_; }
  std::vector<std::string>& names() { return table_.names_; }

  void walkFrom(uint32_t start, std::vector<uint8_t>& state) {
    std::vector<std::pair<uint32_t, size_t>> path{{start, 0}};
    state[start] = 1;
    while (!path.empty()) {
      auto& [node, next] = path.back();
      std::vector<Edge>& edges = parents_[node];
      if (next == edges.size()) {
        finish(node);
        state[node] = 2;
        path.pop_back();
        continue;
      }
      const uint32_t parent = edges[next].parent;
      if (state[parent] == 1) {
        reportCycle(path, parent, edges[next].origin);
        edges.erase(edges.begin() + static_cast<std::ptrdiff_t>(next));
        continue;
      }
      ++next;
      if (state[parent] == 0) {
        state[parent] = 1;
        path.emplace_back(parent, 0);
      }
    }
  }

  void reportCycle(const std::vector<std::pair<uint32_t, size_t>>& path, uint32_t parent, const std::string& origin) {
    std::string chain;
    bool inCycle = false;
    for (const auto& [node, next] : path) {
      inCycle = inCycle || node == parent;
      if (inCycle) chain += names()[node] + " -> ";
    }
    problems_.push_back(fmt::format("{}: the types form a cycle: {}{}; the last link is ignored", origin, chain,
                                    names()[parent]));
  }

  void finish(uint32_t node) {
    std::vector<uint32_t> all;
    for (const Edge& edge : parents_[node]) {
      all.push_back(edge.parent);
      const std::vector<uint32_t>& above = table_.ancestors_[edge.parent];
      all.insert(all.end(), above.begin(), above.end());
    }
    std::sort(all.begin(), all.end());
    all.erase(std::unique(all.begin(), all.end()), all.end());
    if (all.size() > TypeTable::kMaxAncestors) {
      problems_.push_back(fmt::format("{} has more than {} ancestors; the rest are ignored", names()[node],
                                      TypeTable::kMaxAncestors));
      all.resize(TypeTable::kMaxAncestors);
    }
    table_.ancestors_[node] = std::move(all);
  }

  TypeTable& table_;
  std::vector<std::string>& problems_;
  std::vector<std::vector<Edge>> parents_;
  bool reportedFull_ = false;
};

std::shared_ptr<const TypeTable> TypeTableBuilder::build() {
  auto table = std::make_shared<TypeTable>();
  std::vector<std::string> problems = problems_;
  TypeGraph graph(*table, problems);
  // An alias resolves to its canonical name, following a few hops of
  // aliases of aliases (a loop of aliases stops where it started).
  auto resolve = [this](std::string_view name) {
    std::string_view current = name;
    for (int hop = 0; hop < kMaxAliasHops; ++hop) {
      auto alias = aliases_.find(current);
      if (alias == aliases_.end()) break;
      current = aliasTargets_[alias->second];
      if (sameTypeName(current, name)) break;
    }
    return current;
  };
  graph.intern("application/octet-stream", "implicit");
  graph.intern("text/plain", "implicit");
  for (const auto& [type, origin] : types_) graph.intern(resolve(type), origin);
  for (const Link& link : links_) {
    graph.link(graph.intern(resolve(link.type), link.origin), graph.intern(resolve(link.parent), link.origin),
               link.origin);
  }
  for (const std::string& alias : aliasNames_) {
    const int64_t target = graph.intern(resolve(alias), "alias");
    if (target >= 0 && table->index_.find(alias) == table->index_.end()) {
      table->aliases_.emplace(foldedTypeName(alias), static_cast<uint32_t>(target));
    }
  }
  graph.linkImplicitParents();
  graph.closeAncestors();
  table->problems_ = std::move(problems);
  return table;
}

}  // namespace types
