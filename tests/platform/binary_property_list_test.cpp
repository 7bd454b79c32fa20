#include <gmock/gmock.h>
#include <random>

#include "platform/property_list.h"
#include "support/print.h"
#include "support/random_value.h"

namespace kel::platform {
namespace {

using namespace std::string_literals;
using testing::HasSubstr;

void appendNumber(std::string& bytes, std::uint64_t number, std::size_t size) {
  while (size-- > 0) bytes += static_cast<char>(size < 8 ? number >> 8 * size & 0xFF : 0);
}

/// A file of `objects` in this order.
std::string file(const std::vector<std::string>& objects, std::size_t offsetSize = 1,
                 std::size_t referenceSize = 1, std::uint64_t top = 0) {
  std::string bytes = "bplist00";
  std::vector<std::size_t> offsets;
  for (const std::string& object : objects) {
    offsets.push_back(bytes.size());
    bytes += object;
  }
  const std::size_t table = bytes.size();
  for (const std::size_t offset : offsets) appendNumber(bytes, offset, offsetSize);
  bytes.append(6, '\0');
  appendNumber(bytes, offsetSize, 1);
  appendNumber(bytes, referenceSize, 1);
  appendNumber(bytes, objects.size(), 8);
  appendNumber(bytes, top, 8);
  appendNumber(bytes, table, 8);
  return bytes;
}

PropertyListReading read(std::string_view bytes, const PropertyListLimits& limits = {}) {
  // An exact copy on the heap lets the address sanitizer see a read behind the end.
  const Bytes copy(bytes.begin(), bytes.end());
  return readBinaryPropertyList(copy, limits);
}

std::string write(const PropertyListValue& value) {
  const PropertyListWriting writing = writeBinaryPropertyList(value);
  EXPECT_EQ(writing.error, "");
  return writing.bytes ? std::string(writing.bytes->begin(), writing.bytes->end()) : "";
}

TEST(BinaryPropertyListReaderTest, EveryLegalObjectIsRead) {
  struct Case {
    std::string object;
    PropertyListValue value;
  };
  const auto negative = [](std::int64_t number) { return PropertyListValue(number); };
  const Case cases[] = {
      {"\x08", false},
      {"\x09", true},
      {"\x10\xFF", 255},
      {"\x11\xFF\xFF", 65535},
      {"\x12\xFF\xFF\xFF\xFF", 4294967295U},
      {"\x13\xFF\xFF\xFF\xFF\xFF\xFF\xFF\xFE", negative(-2)},
      {"\x13\x7F\xFF\xFF\xFF\xFF\xFF\xFF\xFF", INT64_MAX},
      {"\x14" + std::string(8, '\0') + std::string(8, '\xFF'), UINT64_MAX},
      {"\x14" + std::string(15, '\xFF') + "\xFD", negative(-3)},
      {"\x22\x3F\xC0\0\0"s, 1.5},
      {"\x23\xBF\xF8\0\0\0\0\0\0"s, -1.5},
      {"\x33\x41\x20\0\0\0\0\0\0"s, PropertyListDate{524288}},
      {"\x42\x00\xFF"s, Bytes{0, 255}},
      {"\x40", Bytes{}},
      {"\x4F\x11\x00\x10"s + std::string(16, 'd'), Bytes(16, 'd')},
      {"\x53"
       "a\0c"s,
       "a\0c"s},
      {"\x5F\x10\x01z", "z"},
      {"\x63\0a\xD8\x3D\xDE\0"s, "a\U0001F600"},
      {"\xA0", PropertyListArray{}},
      {"\xD0", PropertyListDictionary{}},
  };
  for (const Case& c : cases) {
    const PropertyListReading reading = read(file({c.object}));
    ASSERT_EQ(reading.error, "") << describe(c.value);
    EXPECT_EQ(*reading.value, c.value);
  }
}

TEST(BinaryPropertyListReaderTest, EverySizeOfOffsetsAndReferencesInAnyOrderIsRead) {
  PropertyListDictionaryBuilder expected;
  expected.set("k", PropertyListArray{"k", 7, 7});
  for (std::size_t size = 1; size <= 8; ++size) {
    std::string dictionary = "\xD1";
    for (const unsigned reference : {0U, 1U}) appendNumber(dictionary, reference, size);
    std::string array = "\xA3";
    for (const unsigned reference : {0U, 2U, 2U}) appendNumber(array, reference, size);
    const PropertyListReading reading =
        read(file({"\x51k", array, "\x10\x07", dictionary, "junk"}, size, size, 3));
    ASSERT_EQ(reading.error, "");
    EXPECT_EQ(*reading.value, PropertyListValue(expected.build()));
  }
}

TEST(BinaryPropertyListReaderTest, OfSeveralValuesUnderOneKeyTheLastStays) {
  EXPECT_EQ(describe(*read(file({"\xD2\1\2\3\4", "\x51k", "\x51k", "\x10\1", "\x10\2"})).value),
            "{\n    k = 2;\n}");
}

TEST(BinaryPropertyListReaderTest, PartsOfSeveralContainersAreDecodedOnceAndShared) {
  const PropertyListReading reading = read(file({"\xA2\1\1", "\xA1\2", "\x54text"}));
  const PropertyListArray& top = *reading.value->asArray();
  EXPECT_EQ(top[0].asArray(), top[1].asArray());
}

TEST(BinaryPropertyListReaderTest, MalformedFilesAreRefusedWithThePlace) {
  const std::string good = file({"\xA1\1", "\x51x"});
  const auto withByte = [&good](std::size_t fromEnd, char byte) {
    std::string bytes = good;
    bytes[bytes.size() - fromEnd] = byte;
    return bytes;
  };
  const std::pair<std::string, std::string> cases[] = {
      {"", "byte 0: too short for a trailer"},
      {"bplist00", "byte 8: too short for a trailer"},
      {"bplist01" + good.substr(8), "byte 0: \"bplist00\" expected"},
      {withByte(26, 0), "byte 20: offset size out of range"},
      {withByte(26, 9), "byte 20: offset size out of range"},
      {withByte(25, 0), "byte 21: reference size out of range"},
      {withByte(24, '\x7F'), "byte 22: more objects than the offset table has room for"},
      {withByte(17, 3), "byte 22: more objects than the offset table has room for"},
      {withByte(9, 2), "byte 30: reference to an object that is not there"},
      {withByte(1, 7), "byte 38: offset table out of range"},
      {withByte(1, 15), "byte 38: offset table out of range"},
      {withByte(8, '\xFF'), "byte 38: offset table out of range"},
      {withByte(34, 7), "byte 12: offset out of range"},
      {withByte(33, 12), "byte 13: offset out of range"},
      {file({}), "byte 24: reference to an object that is not there"},
      {file({"\0"s}), "byte 8: unknown object 0x00"},
      {file({"\x15"}), "byte 8: integer of unknown size"},
      {file({"\x14\0\0\0\0\0\0\0\1\0\0\0\0\0\0\0\0"s}), "byte 8: integer beyond 64 bits"},
      {file({"\x14"s + std::string(8, '\xFF') + std::string(8, '\0')}), "byte 8: integer beyond 64 bits"},
      {file({"\x13\0"s}), "byte 9: longer than the objects' bytes"},
      {file({"\x24\0"s}), "byte 8: unknown object 0x24"},
      {file({"\x32\0\0\0\0"s}), "byte 8: unknown object 0x32"},
      {file({"\xF0"}), "byte 8: unknown object 0xf0"},
      {file({"\x52z"}), "byte 8: longer than the objects' bytes"},
      {file({"\x62\0z\0"s}), "byte 8: longer than the objects' bytes"},
      {file({"\x5F"}), "byte 9: count expected"},
      {file({"\x5F\x23"}), "byte 9: count expected"},
      {file({"\x5F\x13\xFF\xFF\xFF\xFF\xFF\xFF\xFF\xFF"}), "byte 8: negative count"},
      {file({"\xAF\x13\x7F\xFF\xFF\xFF\xFF\xFF\xFF\xFF"}), "byte 8: longer than the objects' bytes"},
      {file({"\xDF\x13\x40\0\0\0\0\0\0\0"s}, 1, 4), "byte 8: longer than the objects' bytes"},
      {file({"\x51\x80"}), "byte 8: ASCII string with other characters"},
      {file({"\x61\xD8\0"s}), "byte 8: UTF-16 string with a lone surrogate"},
      {file({"\xA1\1"}), "byte 9: reference to an object that is not there"},
      {file({"\xD1\1\1", "\x10\1"}), "byte 9: a key that is not a string"},
      {file({"\xA2\1\2", "\x41z", "\xD1\1\1"}), "byte 14: a key that is not a string"},
      {file({"\xA1\0"s}), "byte 9: a container that contains itself"},
      {file({"\xD1\1\2", "\x51k", "\xA1\0"s}), "byte 14: a container that contains itself"},
  };
  for (const auto& [bytes, error] : cases)
    EXPECT_EQ(read(bytes).error, error) << testing::PrintToString(bytes);
}

/// Arrays of one element, each around the next, `levels` in all.
std::string nested(std::size_t levels) {
  std::vector<std::string> objects;
  for (std::size_t i = 1; i < levels; ++i) {
    std::string array = "\xA1";
    appendNumber(array, i, 4);
    objects.push_back(array);
  }
  objects.push_back("\xA0");
  return file(objects, 4, 4);
}

TEST(BinaryPropertyListReaderTest, NestingBeyondTheLimitIsRefused) {
  EXPECT_EQ(read(nested(512)).value->depth(), 512U);
  EXPECT_THAT(read(nested(513)).error, HasSubstr("nested deeper than 512 levels"));
  EXPECT_THAT(read(nested(1'000'000)).error, HasSubstr("nested deeper than 512 levels"));
  EXPECT_EQ(read(nested(3), {3, std::nullopt}).error, "");
  EXPECT_EQ(read(nested(3), {2, std::nullopt}).error, "byte 18: nested deeper than 2 levels");
  // The deep part is decoded first, where it is shallow enough, and then referred to from further below.
  const std::string shared = file({"\xA2\1\3", "\xA1\2", "\xA0", "\xA1\1"});
  EXPECT_EQ(read(shared, {4, std::nullopt}).error, "");
  EXPECT_THAT(read(shared, {3, std::nullopt}).error, HasSubstr("nested deeper than 3 levels"));
}

TEST(BinaryPropertyListReaderTest, TheExpandedSizeIsLimited) {
  const std::string bytes = file({"\xD1\1\2", "\x53key", "\xA2\3\3", "\x54text"});
  const std::uint64_t expanded = read(bytes).value->expandedSize();
  EXPECT_EQ(read(bytes, {.expandedSize = expanded}).error, "");
  EXPECT_THAT(read(bytes, {.expandedSize = expanded - 1}).error, HasSubstr("the value expands to more than"));
}

TEST(BinaryPropertyListReaderTest, SharingThatDoublesAtEveryLevelIsRefusedAtOnce) {
  std::vector<std::string> objects;
  for (char level = 1; level < 100; ++level) objects.push_back(std::string("\xA2") + level + level);
  objects.push_back("\xA0");
  EXPECT_THAT(read(file(objects, 2)).error, HasSubstr("the value expands to more than"));
}

TEST(BinaryPropertyListReaderTest, OverlappingObjectsAreRefusedBeforeTheyCostTime) {
  // 100,000 objects that all lie at one place: a string of a megabyte, or an array of 100,000 elements.
  constexpr std::size_t count = 100'000;
  std::string array = "\xAF\x12";
  appendNumber(array, count, 4);
  for (std::size_t i = 0; i < count; ++i) appendNumber(array, 1, 3);
  for (const std::string& object : {"\x5F\x12\0\x10\0\0"s + std::string(1 << 20, 'x'), array}) {
    std::string top = "\xAF\x12";
    appendNumber(top, count, 4);
    for (std::size_t i = 0; i < count; ++i) appendNumber(top, 2 + i, 3);
    std::string bytes = "bplist00" + top + "\x08" + object;
    const std::size_t table = bytes.size();
    appendNumber(bytes, 8, 4);
    appendNumber(bytes, 8 + top.size(), 4);
    for (std::size_t i = 0; i < count; ++i) appendNumber(bytes, 8 + top.size() + 1, 4);
    bytes += "\0\0\0\0\0\0\4\3"s;
    for (const std::uint64_t number : {2 + count, std::size_t{0}, table}) appendNumber(bytes, number, 8);
    EXPECT_THAT(read(bytes).error, HasSubstr("the value expands to more than"));
  }
}

TEST(BinaryPropertyListReaderTest, DamageNeverReadsOutOfBounds) {
  std::mt19937 random(7);
  for (int round = 0; round < 8; ++round) {
    const std::string bytes = write(randomValue(random, 2));
    for (std::size_t length = 0; length < std::min<std::size_t>(bytes.size(), 1500); ++length) {
      EXPECT_FALSE(read(std::string_view(bytes).substr(0, length)).error.empty()) << "cut to " << length;
    }
    for (std::size_t i = 0; i < bytes.size(); i += 1 + bytes.size() / 1500) {
      for (const unsigned flip : {0x01U, 0x10U, 0x80U, 0xFFU}) {
        std::string damaged = bytes;
        damaged[i] = static_cast<char>(static_cast<unsigned char>(damaged[i]) ^ flip);
        const PropertyListReading reading = read(damaged);
        EXPECT_NE(reading.value.has_value(), !reading.error.empty());
      }
    }
  }
}

TEST(BinaryPropertyListWriterTest, EveryObjectHasTheSmallestForm) {
  const std::pair<PropertyListValue, std::string> cases[] = {
      {true, "\x09"},
      {0, "\x10\0"s},
      {256, "\x11\1\0"s},
      {65536, "\x12\0\1\0\0"s},
      {INT64_MAX, "\x13\x7F\xFF\xFF\xFF\xFF\xFF\xFF\xFF"},
      {-1, "\x13\xFF\xFF\xFF\xFF\xFF\xFF\xFF\xFF"},
      {UINT64_MAX, "\x14" + std::string(8, '\0') + std::string(8, '\xFF')},
      {1.5, "\x23\x3F\xF8\0\0\0\0\0\0"s},
      {PropertyListDate{-1}, "\x33\xBF\xF0\0\0\0\0\0\0"s},
      {Bytes(15, 'd'), "\x4F\x10\x0F" + std::string(15, 'd')},
      {std::string(14, 's'), "\x5E" + std::string(14, 's')},
      {"\u00e9\U0001F600\xFF", "\x64\0\xE9\xD8\x3D\xDE\0\xFF\xFD"s},
      {PropertyListArray(), "\xA0"},
  };
  for (const auto& [value, object] : cases) EXPECT_EQ(write(value), file({object}));
}

TEST(BinaryPropertyListWriterTest, EqualPartsOfOneKindAreStoredOnceAndContainersEach) {
  const PropertyListArray inner{"a"s};
  const PropertyListValue shared(inner);
  EXPECT_EQ(write(PropertyListArray{1, 1.0, true, "a"s, 1, 1.0, true, "a"s, Bytes{1}, Bytes{1},
                                    PropertyListDate{1}, PropertyListDate{1}, shared, shared}),
            file({"\xAE\1\2\3\4\1\2\3\4\5\5\6\6\7\x08", "\x10\1", "\x23\x3F\xF0\0\0\0\0\0\0"s, "\x09",
                  "\x51"
                  "a",
                  "\x41\1", "\x33\x3F\xF0\0\0\0\0\0\0"s, "\xA1\4", "\xA1\4"}));
  PropertyListDictionaryBuilder dictionary;
  dictionary.set("b", "a");
  dictionary.set("a", false);
  EXPECT_EQ(write(dictionary.build()), file({"\xD2\1\2\3\1",
                                             "\x51"
                                             "a",
                                             "\x51"
                                             "b",
                                             "\x08"}));
}

TEST(BinaryPropertyListWriterTest, ReferencesAndOffsetsGrowWithTheFile) {
  for (const unsigned count : {255U, 256U, 65535U, 65536U}) {
    PropertyListArray array;
    for (unsigned i = 0; i < count; ++i) array.emplace_back(i);
    const std::string bytes = write(array);
    const char referenceSize = count < 256 ? 1 : count < 65536 ? 2 : 4;
    EXPECT_EQ(bytes[bytes.size() - 25], referenceSize) << count;
    EXPECT_EQ(bytes[bytes.size() - 26], count < 65535 ? 2 : 4) << count;
    EXPECT_EQ(read(bytes).value, PropertyListValue(array));
  }
}

TEST(BinaryPropertyListWriterTest, WhatIsWrittenReadsBackAndDependsOnTheContentsAlone) {
  std::mt19937 random(1);
  for (int round = 0; round < 200; ++round) {
    const PropertyListValue value = randomValue(random, 3);
    const std::string bytes = write(value);
    const PropertyListReading reading = read(bytes);
    ASSERT_EQ(reading.error, "");
    ASSERT_EQ(*reading.value, value);
    ASSERT_EQ(write(*reading.value), bytes);
    ASSERT_EQ(write(deepCopy(value)), bytes);

    const PropertyListPieces pieces = writeBinaryPropertyListPieces(value);
    std::string joined;
    for (const SharedSlice& piece : pieces.pieces) joined.append(piece.view().begin(), piece.view().end());
    ASSERT_EQ(joined, bytes);
    ASSERT_EQ(pieces.size, bytes.size());
  }
}

TEST(BinaryPropertyListWriterTest, LargeDataIsNotCopiedIntoThePieces) {
  const auto large = std::make_shared<const Bytes>(100'000);
  const PropertyListPieces pieces = writeBinaryPropertyListPieces(PropertyListArray{"x", large, "y"});
  ASSERT_EQ(pieces.pieces.size(), 3U);
  EXPECT_EQ(pieces.pieces[1].bytes, large);
}

TEST(BinaryPropertyListWriterTest, ValuesThatNoReaderAcceptsAreRefused) {
  PropertyListValue deep = PropertyListArray{};
  for (int level = 1; level < 512; ++level) deep = PropertyListArray{deep};
  EXPECT_EQ(read(write(deep)).value, deep);
  EXPECT_EQ(writeBinaryPropertyList(PropertyListArray{deep}).error, "the value nests deeper than 512 levels");
  EXPECT_EQ(writeBinaryPropertyListPieces(PropertyListArray{deep}).error,
            "the value nests deeper than 512 levels");
  PropertyListValue large = "x";
  for (int level = 0; level < 40; ++level) large = PropertyListArray{large, large};
  EXPECT_EQ(writeBinaryPropertyList(large).error, "the value expands to more than 1073741824 bytes");
}

}  // namespace
}  // namespace kel::platform
