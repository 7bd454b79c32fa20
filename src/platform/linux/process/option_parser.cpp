#include <algorithm>
#include <cstdio>
#include <cstring>
#include <getopt.h>
#include <string_view>

#include "platform/process.h"

namespace kel::platform {

namespace {

/// The next argument that the C library's parser will look at as an option, or null.
const char* nextOptionArgument(const std::vector<char*>& arguments) {
  for (std::size_t i = static_cast<std::size_t>(std::max(optind, 1)); i + 1 < arguments.size(); ++i) {
    const std::string_view argument(arguments[i]);
    if (argument == "--") return nullptr;
    if (argument.size() > 1 && argument.front() == '-') return arguments[i];
  }
  return nullptr;
}

/// True for one dash and one letter that is not itself the name of an option.
bool isLoneLetter(std::string_view argument, const std::vector<LongOption>& options) {
  if (argument.starts_with("--")) return false;
  const std::string_view name = argument.substr(1, argument.find('=') - 1);
  return name.size() == 1 &&
         std::ranges::none_of(options, [name](const LongOption& option) { return option.name == name; });
}

}  // namespace

OptionParser::OptionParser(std::vector<std::string> arguments, std::vector<LongOption> options)
    : arguments_(std::move(arguments)), options_(std::move(options)) {
  for (std::string& argument : arguments_) pointers_.push_back(argument.data());
  pointers_.push_back(nullptr);
  optind = 0;  // makes the library forget an earlier parse
}

ParsedOption OptionParser::next() {
  std::vector<option> table;
  for (const LongOption& row : options_) table.push_back({row.name.c_str(), no_argument, nullptr, row.value});
  table.push_back({});
  // The library takes a lone letter for an abbreviation: it is left to step over it in silence.
  const char* argument = nextOptionArgument(pointers_);
  const bool isRefused = argument && isLoneLetter(argument, options_);
  opterr = isRefused ? 0 : 1;
  const int count = static_cast<int>(arguments_.size());
  const int result = getopt_long_only(count, pointers_.data(), "", table.data(), nullptr);
  if (result == -1) return {ParsedOption::Outcome::End, 0};
  if (isRefused) std::fprintf(stderr, "%s: unrecognized option '%s'\n", pointers_[0], argument);
  if (isRefused || result == '?') return {ParsedOption::Outcome::Bad, 0};
  return {ParsedOption::Outcome::Option, result};
}

std::vector<std::string> OptionParser::remaining() const {
  std::vector<std::string> result;
  for (std::size_t i = static_cast<std::size_t>(optind); i + 1 < pointers_.size(); ++i) {
    result.emplace_back(pointers_[i]);
  }
  return result;
}

}  // namespace kel::platform
