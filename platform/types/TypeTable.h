#pragma once

// TypeTable: one immutable state of the type hierarchy, and the builder
// that makes it.
//
// Type A conforms to type B when A is B (after aliases are resolved), or B
// is an ancestor of A: a parent, a parent's parent, and so on. Parents come
// from three places: the shared MIME database's subclass lines, Tenon's own
// type declarations, and the parents every MIME type has without saying
// so: every text/* type is a text/plain, and every type but the inode/* ones
// is an application/octet-stream. A MIME type the tables do not know still
// has those implicit parents. B may also be a media range "major/*": A
// conforms to it when A or one of A's ancestors has that major type.
//
// An alias names the same type as its canonical name: it conforms to
// everything the canonical type conforms to and the other way round.
//
// A parent link that would close a cycle is left out when the table is
// built and reported in problems(), so every chain of parents ends. The
// builder also bounds what it keeps (kMaxTypes names, kMaxParents parents of
// one type, kMaxAncestors ancestors of one type) and reports what it left
// out.
//
// Thread-safe once built: nothing changes it.

#include <cstdint>
#include <memory>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "platform/types/TypeName.h"

namespace types {

class TypeTable {
 public:
  static constexpr size_t kMaxTypes = 16384;
  static constexpr size_t kMaxParents = 64;
  static constexpr size_t kMaxAncestors = 256;

  // True when type conforms to `to` (see above). Names that are not type
  // names conform to nothing, not even to themselves.
  bool conforms(std::string_view type, std::string_view to) const;

  // The canonical name of type (aliases resolved), in lower case.
  std::string canonicalName(std::string_view type) const;
  // type's ancestors, canonical and in lower case, in no promised order;
  // includes the implicit parents.
  std::vector<std::string> ancestors(std::string_view type) const;

  // How many distinct canonical types the table knows.
  size_t size() const { return names_.size(); }
  // What building left out or found wrong, one line each, naming the
  // source ("/usr/share/mime/subclasses:12: ...").
  const std::vector<std::string>& problems() const { return problems_; }

 private:
  friend class TypeTableBuilder;
  friend class TypeGraph;
  using Index = std::unordered_map<std::string, uint32_t, FoldedHash, FoldedEqual>;

  // The index of name after alias resolution, or -1.
  int64_t find(std::string_view name) const;
  // Positions of the ancestors of a type the table does not know: its
  // implicit parents and theirs.
  std::vector<uint32_t> implicitAncestors(std::string_view type) const;
  bool hasAncestor(uint32_t type, uint32_t ancestor) const;
  bool conformsToRange(std::string_view type, int64_t index, std::string_view major) const;

  Index index_;                                 // canonical name -> position
  Index aliases_;                               // alias -> position of its canonical type
  std::vector<std::string> names_;              // folded canonical names
  std::vector<std::vector<uint32_t>> ancestors_;  // sorted positions, self excluded
  std::vector<std::string> problems_;
};

// Collects subclass lines, aliases and declarations in the order of their
// sources' precedence, then makes the table. Not thread-safe.
class TypeTableBuilder {
 public:
  // `origin` names the source for problems ("path:line").
  void addParent(std::string_view type, std::string_view parent, const std::string& origin);
  // The first alias of a name wins; later ones are reported.
  void addAlias(std::string_view alias, std::string_view canonical, const std::string& origin);
  // Marks a type as known even without parents.
  void addType(std::string_view type, const std::string& origin);
  void addProblem(std::string problem) { problems_.push_back(std::move(problem)); }

  std::shared_ptr<const TypeTable> build();

 private:
  struct Link {
    std::string type, parent, origin;
  };
  TypeTable::Index aliases_;  // alias -> canonical, as given
  std::vector<std::string> aliasNames_;
  std::vector<std::string> aliasTargets_;
  std::vector<Link> links_;
  std::vector<std::pair<std::string, std::string>> types_;
  std::vector<std::string> problems_;
};

// The parents every MIME type has without saying so (none for other names).
std::vector<std::string_view> implicitParents(std::string_view type);

}  // namespace types
