#include "common/path_set.h"

namespace kel {

void PathSet::insert(const std::string& path) {
  all_.insert(path);
  if (holdsPrefixOf(path)) return;
  auto longer = shortest_.lower_bound(path);
  while (longer != shortest_.end() && longer->starts_with(path)) longer = shortest_.erase(longer);
  shortest_.insert(longer, path);
}

const std::string* PathSet::shortestPrefixOf(std::string_view path) const {
  auto candidate = shortest_.upper_bound(path);
  if (candidate == shortest_.begin()) return nullptr;
  --candidate;
  return path.starts_with(*candidate) ? &*candidate : nullptr;
}

void PathSet::addElementsUnder(std::string_view path, std::set<std::string>& found) const {
  for (auto element = all_.lower_bound(path); element != all_.end() && element->starts_with(path);
       ++element) {
    found.insert(*element);
  }
}

}  // namespace kel
