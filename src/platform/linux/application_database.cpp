#include "platform/linux/application_database.h"

#include <algorithm>
#include <concepts>
#include <string_view>
#include <utility>

#include "platform/digest.h"

namespace kel::platform {

namespace {

constexpr std::string_view mark = "kel applications\n";
constexpr std::string_view version = "format 1 of kel " KEL_VERSION "\n";

constexpr std::uint8_t hasInformation = 1;
constexpr std::size_t smallestEntry = 5;        // of an empty path
constexpr std::uint32_t mostEntries = 500'000;  // each costs some 150 bytes of memory beyond its own

template <std::unsigned_integral Number>
void append(Bytes& bytes, Number number) {
  for (std::size_t i = 0; i < sizeof number; ++i) bytes.push_back(static_cast<std::uint8_t>(number >> 8 * i));
}

void append(Bytes& bytes, std::string_view text) { bytes.insert(bytes.end(), text.begin(), text.end()); }

/// Takes values off the front; once something is missing, all further ones are zero and empty.
class Reader {
 public:
  explicit Reader(BytesView rest) : rest_(rest) {}

  template <std::unsigned_integral Number>
  Number number() {
    Number number = 0;
    const BytesView taken = bytes(sizeof number);
    for (std::size_t i = taken.size(); i-- > 0;) number = static_cast<Number>(number << 8 | taken[i]);
    return number;
  }

  BytesView bytes(std::size_t count) {
    if (count > rest_.size()) {
      isShort_ = true;
      rest_ = {};
      return {};
    }
    const BytesView taken = rest_.first(count);
    rest_ = rest_.subspan(count);
    return taken;
  }

  bool takes(std::string_view expected) {
    const BytesView taken = bytes(expected.size());
    return std::equal(expected.begin(), expected.end(), taken.begin(), taken.end());
  }

  BytesView rest() const { return rest_; }
  bool isShort() const { return isShort_; }

 private:
  BytesView rest_;
  bool isShort_ = false;
};

/// Absent unless the payload is what the writer would write.
std::optional<RememberedApplications> decodePayload(BytesView payload) {
  Reader reader(payload);
  const auto count = reader.number<std::uint32_t>();
  if (count > mostEntries || count > reader.rest().size() / smallestEntry) return std::nullopt;
  RememberedApplications applications;
  for (std::uint32_t i = 0; i < count; ++i) {
    const BytesView path = reader.bytes(reader.number<std::uint32_t>());
    const auto kind = reader.number<std::uint8_t>();
    RememberedApplication application;
    if (kind == hasInformation) {
      FileIdentity& identity = application.information.emplace();
      identity.inode = reader.number<std::uint64_t>();
      identity.changeTime = reader.number<std::uint64_t>();
      identity.modificationTime = reader.number<std::uint64_t>();
      identity.size = reader.number<std::uint64_t>();
      application.flags = reader.number<std::uint32_t>();
    }
    std::string key(path.begin(), path.end());
    const bool inOrder = applications.empty() || applications.rbegin()->first < key;
    if (reader.isShort() || kind > hasInformation || !inOrder) return std::nullopt;
    applications.emplace_hint(applications.end(), std::move(key), application);
  }
  if (reader.isShort() || !reader.rest().empty()) return std::nullopt;
  return applications;
}

}  // namespace

std::optional<Bytes> encodeApplications(const RememberedApplications& applications) {
  if (applications.size() > mostEntries) return std::nullopt;
  Bytes payload;
  append(payload, static_cast<std::uint32_t>(applications.size()));
  for (const auto& [path, application] : applications) {
    append(payload, static_cast<std::uint32_t>(path.size()));
    append(payload, path);
    append(payload, static_cast<std::uint8_t>(application.information ? hasInformation : 0));
    if (!application.information) continue;
    append(payload, application.information->inode);
    append(payload, application.information->changeTime);
    append(payload, application.information->modificationTime);
    append(payload, application.information->size);
    append(payload, application.flags);
  }
  Bytes bytes = sealApplicationDatabase(payload);
  return bytes.size() <= largestApplicationDatabase ? std::optional(std::move(bytes)) : std::nullopt;
}

Bytes sealApplicationDatabase(BytesView payload) {
  const Digest digest = md5(payload);
  Bytes bytes(mark.size() + version.size() + digest.size() + payload.size());
  auto end = std::ranges::copy(mark, bytes.begin()).out;
  end = std::ranges::copy(version, end).out;
  end = std::ranges::copy(digest, end).out;
  std::ranges::copy(payload, end);
  return bytes;
}

ApplicationDatabaseReading decodeApplications(BytesView bytes) {
  Reader reader(bytes);
  if (bytes.size() > largestApplicationDatabase) return {std::nullopt, "too large"};
  if (!reader.takes(mark)) return {std::nullopt, "no application database"};
  if (!reader.takes(version)) return {std::nullopt, "written by another version"};
  const BytesView digest = reader.bytes(std::tuple_size_v<Digest>);
  const Digest expected = md5(reader.rest());
  if (!std::ranges::equal(digest, expected)) return {std::nullopt, "damaged"};
  auto applications = decodePayload(reader.rest());
  if (!applications) return {std::nullopt, "malformed"};
  return {std::move(applications), {}};
}

}  // namespace kel::platform
