#pragma once

#include <string>
#include <string_view>
#include <vector>

namespace kel::platform {

/// What is mounted on the way to `directories` (without a trailing "/") and below them, from the text of the
/// kernel's table (mountinfo): one line each, in the table's order, in which what covers comes after what it
/// covers. Two results are equal when the same mounts lie in the same order. A line that names no mount point
/// is taken for one that matters.
std::vector<std::string> mountsAround(const std::vector<std::string>& directories, std::string_view table);

}  // namespace kel::platform
