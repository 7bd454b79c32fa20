#pragma once

#include <optional>
#include <set>
#include <string>
#include <string_view>

namespace kel {

/// A set of path strings that answers plain string prefix questions in logarithmic time.
class PathSet {
 public:
  void insert(const std::string& path);

  bool empty() const { return all_.empty(); }
  const std::set<std::string, std::less<>>& elements() const { return all_; }

  /// The shortest element that `path` begins with (`path` itself counts), or null. Valid until the next
  /// insertion.
  const std::string* shortestPrefixOf(std::string_view path) const;

  /// True when `path` equals an element or begins with one.
  bool holdsPrefixOf(std::string_view path) const { return shortestPrefixOf(path) != nullptr; }

  /// Adds every element that begins with `path` to `found`.
  void addElementsUnder(std::string_view path, std::set<std::string>& found) const;

 private:
  std::set<std::string, std::less<>> all_;

  // The elements that begin with no other one. Between such an element and any string that begins with it no
  // further one can sort, so the nearest one below a string is the only candidate.
  std::set<std::string, std::less<>> shortest_;
};

}  // namespace kel
