#include "platform/linux/registry/application_database.h"

#include <limits>
#include <utility>

#include "platform/linux/files/sealed_bytes.h"

namespace kel::platform {

namespace {

constexpr std::size_t mostEntries = 500'000;  // each costs some 150 bytes of memory beyond its own

}  // namespace

std::optional<Bytes> encodeApplications(const RememberedApplications& applications) {
  if (applications.size() > mostEntries) return std::nullopt;
  ByteWriter writer;
  writer.number(applications.size());
  for (const auto& [path, application] : applications) {
    writer.string(path);
    writeStatus(writer, application.information);
    writer.number(application.flags);
  }
  Bytes file = writer.sealed(applicationDatabaseFormat);
  return file.size() <= largestApplicationDatabase ? std::optional(std::move(file)) : std::nullopt;
}

std::optional<RememberedApplications> decodeApplications(BytesView file) {
  auto reader = ByteReader::open(file, applicationDatabaseFormat);
  if (!reader || file.size() > largestApplicationDatabase) return std::nullopt;
  RememberedApplications applications;
  const std::size_t count = reader->count();
  if (count > mostEntries) reader->fail();
  for (std::size_t left = count; left > 0 && !reader->failed(); --left) {
    std::string path(reader->string());
    const EntryStatus information = readStatus(*reader);
    const std::uint64_t flags = reader->number();
    // As they were written: so they are also different, and the map need not search for their places.
    const bool isInOrder = applications.empty() || applications.rbegin()->first < path;
    if (!isInOrder || flags > std::numeric_limits<std::uint32_t>::max()) reader->fail();
    applications.emplace_hint(applications.end(), std::move(path),
                              RememberedApplication{information, static_cast<std::uint32_t>(flags)});
  }
  return reader->atEnd() ? std::optional(std::move(applications)) : std::nullopt;
}

}  // namespace kel::platform
