#include "platform/linux/process/linux_system_facts.h"

#include <cerrno>
#include <charconv>
#include <fcntl.h>
#include <string_view>
#include <unistd.h>

#include "platform/linux/files/files.h"
#include "property_lists/digest.h"
#include "property_lists/unicode.h"

namespace kel::platform {

namespace {

// Raised when an older program's cache must not be read.
constexpr int cacheFormat = 1;

SystemReading failure(int errorNumber) { return {std::nullopt, errorNumber, errorText(errorNumber)}; }

std::string_view trimmed(std::string_view text) {
  constexpr std::string_view blanks = " \t\r\n";
  const std::size_t start = text.find_first_not_of(blanks);
  if (start == std::string_view::npos) return {};
  return text.substr(start, text.find_last_not_of(blanks) + 1 - start);
}

/// The value of a shell assignment: quotes taken off, backslashes resolved (they are plain in single quotes).
std::string unquoted(std::string_view value) {
  char quote = '\0';
  if (value.size() >= 2 && (value.front() == '"' || value.front() == '\'') && value.back() == value.front()) {
    quote = value.front();
    value = value.substr(1, value.size() - 2);
  }
  std::string result;
  for (std::size_t i = 0; i < value.size(); ++i) {
    if (value[i] == '\\' && quote != '\'' && i + 1 < value.size()) ++i;
    result += value[i];
  }
  return result;
}

std::map<std::string, std::string> parseAssignments(std::string_view text) {
  std::map<std::string, std::string> result;
  while (!text.empty()) {
    const std::size_t end = std::min(text.find('\n'), text.size());
    const std::string_view line = trimmed(text.substr(0, end));
    text.remove_prefix(std::min(end + 1, text.size()));
    const std::size_t equals = line.find('=');
    if (line.starts_with('#') || equals == std::string_view::npos) continue;
    std::string value = unquoted(line.substr(equals + 1));
    if (isValidUTF8(value)) result.insert_or_assign(std::string(line.substr(0, equals)), std::move(value));
  }
  return result;
}

std::string systemVersion(const std::string& root) {
  auto text = readSmallFile(AT_FDCWD, root + "/etc/os-release");
  if (!text) text = readSmallFile(AT_FDCWD, root + "/usr/lib/os-release");
  const auto fields = parseAssignments(text.value_or(""));
  const auto field = [&fields](const char* name) {
    const auto found = fields.find(name);
    return found == fields.end() ? std::string() : found->second;
  };
  const std::string build = field("BUILD_ID");
  std::string version;
  for (const std::string& part :
       {field("ID"), field("VERSION_ID"), build.empty() ? field("IMAGE_VERSION") : build}) {
    if (part.empty()) continue;
    if (!version.empty()) version += ' ';
    version += part;
  }
  return version.empty() ? "<unknown version>" : version;
}

}  // namespace

LinuxSystemFacts::LinuxSystemFacts(std::string root) : root_(std::move(root)) {
  for (char** variable = environ; variable && *variable; ++variable) {
    const std::string_view assignment(*variable);
    const std::size_t equals = assignment.find('=');
    if (equals == std::string_view::npos) continue;
    environment_.emplace(assignment.substr(0, equals), assignment.substr(equals + 1));
  }
}

std::string LinuxSystemFacts::buildVersion() {
  return systemVersion(root_) + " (kel " KEL_VERSION ", cache format " + std::to_string(cacheFormat) + ")";
}

SystemReading LinuxSystemFacts::bootTime() {
  const auto text = readSmallFile(AT_FDCWD, root_ + "/proc/sys/kernel/random/boot_id");
  if (!text) return failure(errno);
  const std::string_view identifier = trimmed(*text);
  if (identifier.empty()) return failure(ENODATA);
  const Digest digest = md5({reinterpret_cast<const std::uint8_t*>(identifier.data()), identifier.size()});
  std::uint64_t number = 0;
  for (std::size_t i = 0; i < sizeof number; ++i) number = number << 8 | digest[i];
  // One bit less, so that it is never negative.
  return {static_cast<std::int64_t>(number >> 1), 0, {}};
}

SystemReading LinuxSystemFacts::auditSession() {
  const auto text = readSmallFile(AT_FDCWD, root_ + "/proc/self/sessionid");
  if (!text) return failure(errno);
  const std::string_view digits = trimmed(*text);
  std::uint32_t session = 0;
  const auto [end, error] = std::from_chars(digits.data(), digits.data() + digits.size(), session);
  if (error != std::errc() || end != digits.data() + digits.size()) return failure(EINVAL);
  return {static_cast<std::int32_t>(session), 0, {}};
}

std::uint32_t LinuxSystemFacts::realUserID() { return getuid(); }

std::uint32_t LinuxSystemFacts::random32() { return static_cast<std::uint32_t>(randomNumber()); }

std::optional<std::string> LinuxSystemFacts::environmentVariable(const std::string& name) {
  const auto found = environment_.find(name);
  return found == environment_.end() ? std::nullopt : std::optional(found->second);
}

}  // namespace kel::platform
