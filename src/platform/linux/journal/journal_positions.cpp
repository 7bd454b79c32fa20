#include "platform/linux/journal/journal_positions.h"

#include <algorithm>
#include <utility>

#include "platform/linux/files/files.h"
#include "platform/linux/files/sealed_bytes.h"

namespace kel::platform {

namespace {

constexpr std::string_view positionFormat = "kel journal position 3";
constexpr EventID blockSize = EventID{1} << 40;
constexpr EventID largest = EventID{1} << 62;
constexpr std::size_t mostRanges = 64;

}  // namespace

JournalPositions::JournalPositions(FileSystem& files, SystemLog& log, std::string path)
    : files_(files), log_(log), path_(std::move(path)) {}

bool JournalPositions::open(EventID indexID) {
  const FileReading file = path_.empty() ? FileReading() : files_.read(path_, 65536);
  auto reader = file.bytes ? ByteReader::open(*file.bytes, positionFormat) : std::nullopt;
  EventID reserved = reader ? reader->number() : 0;
  const EventID indexNeeded = reader ? reader->number() : 0;
  for (std::size_t left = reader ? reader->count() : 0; left > 0; --left) {
    const EventID first = reader->number();
    earlier_.push_back({first, reader->number()});
    if (first == 0 || earlier_.back().last < first || earlier_.back().last > reserved) reader->fail();
  }
  const bool isUsable = reader && reader->atEnd() && std::max(reserved, indexID) < largest;
  if (!isUsable) {
    if (file.bytes) log_.write(path_ + ": damaged, starting without a journal");
    reserved = indexID = 0;
  }
  // An index older than that lacks what positions know.
  if (!isUsable || indexID < indexNeeded) earlier_.clear();
  hasRanges_ = !earlier_.empty();
  indexID_ = indexID;
  first_ = std::max(reserved, indexID) + blockSize / 256 + randomNumber() % blockSize;
  last_ = first_;
  return isUsable;
}

bool JournalPositions::reserve() {
  if (!isReserved_ && !path_.empty()) isReserved_ = write(true);
  return isReserved_;
}

bool JournalPositions::isKnown(EventID position) const {
  if (position >= first_ && position <= last_) return true;
  return std::ranges::any_of(
      earlier_, [position](const Range& range) { return position >= range.first && position <= range.last; });
}

bool JournalPositions::trust(EventID indexID, EventID upTo) {
  indexID_ = indexID;
  if (told_ > indexID_) return true;  // not before a newer index
  const EventID before = std::exchange(trusted_, upTo);
  const bool isWritten = write(true);
  isReserved_ = isReserved_ || isWritten;
  if (!isWritten) trusted_ = before;
  return isWritten;
}

bool JournalPositions::tell(EventID event) {
  if (event <= indexID_) return true;
  told_ = std::max(told_, event);
  trusted_ = 0;
  return !hasRanges_ || path_.empty() || write(false);
}

bool JournalPositions::write(bool withRanges) {
  std::vector<Range> ranges = withRanges ? earlier_ : std::vector<Range>();
  if (withRanges && trusted_ != 0) ranges.push_back({first_, trusted_});
  if (ranges.size() > mostRanges) ranges.erase(ranges.begin());
  ByteWriter writer;
  writer.number(first_ + blockSize);
  writer.number(indexID_);
  writer.number(ranges.size());
  for (const Range& range : ranges) {
    writer.number(range.first);
    writer.number(range.last);
  }
  if (const auto error = files_.writeAtomically(path_, writer.sealed(positionFormat))) {
    if (!std::exchange(failureReported_, true)) log_.write("Cannot keep the journal's position: " + *error);
    return false;
  }
  failureReported_ = false;
  hasRanges_ = !ranges.empty();
  return true;
}

}  // namespace kel::platform
