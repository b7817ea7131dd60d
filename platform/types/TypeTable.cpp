#include "platform/types/TypeTable.h"

#include <algorithm>
#include <utility>

#include <fmt/format.h>

namespace types {
namespace {

constexpr std::string_view kOctetStream = "application/octet-stream";
constexpr std::string_view kPlainText = "text/plain";

}  // namespace

std::vector<std::string_view> implicitParents(std::string_view type) {
  std::vector<std::string_view> parents;
  if (!isMimeTypeName(type) || sameTypeName(majorType(type), "inode")) return parents;
  if (sameTypeName(majorType(type), "text") && !sameTypeName(type, kPlainText)) parents.push_back(kPlainText);
  if (!sameTypeName(type, kOctetStream)) parents.push_back(kOctetStream);
  return parents;
}

// --- TypeTable ---

int64_t TypeTable::find(std::string_view name) const {
  if (auto alias = aliases_.find(name); alias != aliases_.end()) return alias->second;
  if (auto known = index_.find(name); known != index_.end()) return known->second;
  return -1;
}

bool TypeTable::hasAncestor(uint32_t type, uint32_t ancestor) const {
  const std::vector<uint32_t>& list = ancestors_[type];
  return std::binary_search(list.begin(), list.end(), ancestor);
}

std::vector<uint32_t> TypeTable::implicitAncestors(std::string_view type) const {
  std::vector<uint32_t> positions;
  for (std::string_view parent : implicitParents(type)) {
    const int64_t position = find(parent);  // always known: the builder adds both
    if (position < 0) continue;
    positions.push_back(static_cast<uint32_t>(position));
    positions.insert(positions.end(), ancestors_[position].begin(), ancestors_[position].end());
  }
  return positions;
}

bool TypeTable::conformsToRange(std::string_view type, int64_t index, std::string_view major) const {
  if (sameTypeName(majorType(type), major)) return true;
  if (index >= 0 && sameTypeName(majorType(names_[index]), major)) return true;
  const auto hasMajor = [&](uint32_t position) { return sameTypeName(majorType(names_[position]), major); };
  if (index >= 0) return std::any_of(ancestors_[index].begin(), ancestors_[index].end(), hasMajor);
  const std::vector<uint32_t> implicit = implicitAncestors(type);
  return std::any_of(implicit.begin(), implicit.end(), hasMajor);
}

bool TypeTable::conforms(std::string_view type, std::string_view to) const {
  if (!isTypeName(type)) return false;
  const int64_t index = find(type);
  if (isMediaRange(to)) return conformsToRange(type, index, to.substr(0, to.size() - 2));
  if (!isTypeName(to)) return false;
  const int64_t target = find(to);
  if (index < 0) {
    if (sameTypeName(type, to)) return true;
    const std::vector<uint32_t> implicit = implicitAncestors(type);
    return target >= 0 && std::find(implicit.begin(), implicit.end(), target) != implicit.end();
  }
  if (target < 0) return false;  // every ancestor of a known type is known
  return index == target || hasAncestor(static_cast<uint32_t>(index), static_cast<uint32_t>(target));
}

std::string TypeTable::canonicalName(std::string_view type) const {
  const int64_t index = find(type);
  return index >= 0 ? names_[index] : foldedTypeName(type);
}

std::vector<std::string> TypeTable::ancestors(std::string_view type) const {
  const int64_t index = find(type);
  std::vector<uint32_t> positions = index >= 0 ? ancestors_[index] : implicitAncestors(type);
  std::sort(positions.begin(), positions.end());
  positions.erase(std::unique(positions.begin(), positions.end()), positions.end());
  std::vector<std::string> names;
  for (uint32_t position : positions) names.push_back(names_[position]);
  return names;
}

// --- TypeTableBuilder ---

void TypeTableBuilder::addParent(std::string_view type, std::string_view parent, const std::string& origin) {
  links_.push_back(Link{std::string(type), std::string(parent), origin});
}

void TypeTableBuilder::addAlias(std::string_view alias, std::string_view canonical, const std::string& origin) {
  if (sameTypeName(alias, canonical)) return;
  if (!aliases_.emplace(std::string(alias), static_cast<uint32_t>(aliasTargets_.size())).second) {
    problems_.push_back(fmt::format("{}: {} is already an alias; this one is ignored", origin, alias));
    return;
  }
  aliasNames_.emplace_back(alias);
  aliasTargets_.emplace_back(canonical);
}

void TypeTableBuilder::addType(std::string_view type, const std::string& origin) {
  types_.emplace_back(std::string(type), origin);
}

}  // namespace types
