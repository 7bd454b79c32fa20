#include "platform/option_parser.h"

#include <algorithm>
#include <cstdio>
#include <cstring>
#include <getopt.h>
#include <string_view>

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

struct OptionParser::Body {
  std::vector<std::string> arguments;
  const std::vector<LongOption> options;
  std::vector<char*> pointers;  // to the arguments and null, in the order that the library gives them
};

OptionParser::OptionParser(std::vector<std::string> arguments, std::vector<LongOption> options)
    : body_(new Body{std::move(arguments), std::move(options), {}}) {
  for (std::string& argument : body_->arguments) body_->pointers.push_back(argument.data());
  body_->pointers.push_back(nullptr);
  optind = 0;  // makes the library forget an earlier parse
}

OptionParser::~OptionParser() = default;

ParsedOption OptionParser::next() {
  auto& [arguments, options, pointers] = *body_;
  std::vector<option> table;
  for (const LongOption& row : options) table.push_back({row.name.c_str(), no_argument, nullptr, row.value});
  table.push_back({});
  // The library takes a lone letter for an abbreviation: it is left to step over it in silence.
  const char* argument = nextOptionArgument(pointers);
  const bool isRefused = argument && isLoneLetter(argument, options);
  opterr = isRefused ? 0 : 1;
  const int count = static_cast<int>(arguments.size());
  const int result = getopt_long_only(count, pointers.data(), "", table.data(), nullptr);
  if (result == -1) return {ParsedOption::Outcome::End, 0};
  if (isRefused) std::fprintf(stderr, "%s: unrecognized option '%s'\n", pointers[0], argument);
  if (isRefused || result == '?') return {ParsedOption::Outcome::Bad, 0};
  return {ParsedOption::Outcome::Option, result};
}

std::vector<std::string> OptionParser::remaining() const {
  std::vector<std::string> result;
  for (std::size_t i = static_cast<std::size_t>(optind); i + 1 < body_->pointers.size(); ++i) {
    result.emplace_back(body_->pointers[i]);
  }
  return result;
}

}  // namespace kel::platform
