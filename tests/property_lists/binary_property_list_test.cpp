#include <array>
#include <bit>
#include <random>

#include "property_lists/property_list.h"
#include "property_lists/unicode.h"
#include "support/property_lists.h"

namespace kel::platform {
namespace {

using namespace std::string_literals;
using namespace test;
using namespace testing;

std::string number(std::uint64_t value, std::size_t size) {
  std::string bytes;
  while (size-- > 0) bytes += static_cast<char>(value >> 8 * size & 0xFF);
  return bytes;
}

/// A file of `objects` in this order. An empty object lies where the next one does.
std::string file(const std::vector<std::string>& objects, std::size_t offsetSize = 1,
                 std::size_t referenceSize = 1, std::uint64_t top = 0) {
  std::string bytes = "bplist00", offsets;
  for (const std::string& object : objects) {
    offsets += number(bytes.size(), offsetSize);
    bytes += object;
  }
  return bytes + offsets + number(offsetSize, 7) + number(referenceSize, 1) + number(objects.size(), 8) +
         number(top, 8) + number(bytes.size(), 8);
}

PropertyListReading read(std::string_view bytes, const PropertyListLimits& limits = {}) {
  // An exact copy on the heap lets the address sanitizer see a read behind the end.
  return readBinaryPropertyList(Bytes(bytes.begin(), bytes.end()), limits);
}

std::string write(const PropertyListValue& value) {
  const PropertyListWriting writing = writeBinaryPropertyList(value);
  EXPECT_EQ(writing.error, "");
  return writing.bytes ? std::string(writing.bytes->begin(), writing.bytes->end()) : "";
}

std::string randomText(std::mt19937& random) {
  constexpr std::u32string_view characters = U"aaaKKKkey////  \"\\\n\r\t\x1b\x7f\u00e9\u4f60\U0001F600$-_.:";
  std::string text;
  for (auto count = random() % 6; count > 0; --count)
    appendUTF8(text, characters[random() % characters.size()]);
  return random() % 16 == 0 ? text + std::string(random() % 400, 'x') : text;
}

PropertyListValue randomLeaf(std::mt19937& random) {
  const std::uint64_t bits = (static_cast<std::uint64_t>(random()) << 32 | random()) >> random() % 64;
  const PropertyListValue leaves[] = {
      bits % 2 == 0,
      bits,
      static_cast<std::int64_t>(bits),
      std::bit_cast<double>(bits),
      Bytes(random() % (random() % 8 == 0 ? 10000 : 20), static_cast<std::uint8_t>(bits)),
      PropertyListDate{static_cast<double>(random()) * 4.5 - 9e9},
      randomText(random)};
  return leaves[random() % std::size(leaves)];
}

/// A value of any kind, containers nesting at most `depth` levels. The same state of `random` gives an equal
/// value that shares no part with the first. Strings and numbers repeat now and then.
PropertyListValue randomValue(std::mt19937& random, int depth) {
  if (depth == 0 || random() % 4 == 0) return randomLeaf(random);
  PropertyListArray array;
  for (auto count = random() % 20; count > 0; --count) array.push_back(randomValue(random, depth - 1));
  if (random() % 2 == 0) return array;
  PropertyListDictionaryBuilder builder;
  for (const PropertyListValue& value : array) builder.set(randomText(random), value);
  return builder.build();
}

TEST(BinaryPropertyListTest, EveryObjectIsReadAndTheSmallestFormWritten) {
  const auto objects = listOf<std::string>(
      "\xAF\x10\x14\1\2\3\4\5\6\7\x08\x09\x0A\x0B\x0C\x0D\x0E\x0F\x10\x11\x12\x13\x14", "\x08", "\x09",
      "\x10\0"s, "\x10\xFF", "\x11\1\0"s, "\x12\0\1\0\0"s, "\x12\xFF\xFF\xFF\xFF",
      "\x13\x7F" + number(UINT64_MAX, 7), "\x13" + number(UINT64_MAX - 1, 8),
      "\x14" + number(0, 8) + number(UINT64_MAX, 8), "\x23\xBF\xF8\0\0\0\0\0\0"s, "\x33\x41\x20\0\0\0\0\0\0"s,
      "\x40", "\x42\0\xFF"s, "\x4F\x10\x0F" + std::string(15, 'd'), "\x5E" + std::string(14, 's'),
      "\x53x\0z"s, "\x63\0\xE9\xD8\x3D\xDE\0"s, "\xA0", "\xD0");
  const PropertyListValue values = listOf<PropertyListValue>(
      false, true, 0, 255, 256, 65536, 4294967295U, INT64_MAX, -2, UINT64_MAX, -1.5, PropertyListDate{524288},
      Bytes{}, Bytes{0, 255}, Bytes(15, 'd'), std::string(14, 's'), "x\0z"s, "\u00e9\U0001F600",
      PropertyListArray{}, PropertyListDictionary{});
  EXPECT_EQ(read(file(objects)).value, values);
  EXPECT_EQ(write(values), file(objects));
  EXPECT_EQ(write("\xFF\u00e9"), file({"\x62\xFF\xFD\0\xE9"s}));
  EXPECT_EQ(read(file({"\xA4\1\2\3\4", "\x14" + number(UINT64_MAX, 8) + number(UINT64_MAX - 2, 8),
                       "\x22\x3F\xC0\0\0"s, "\x4F\x11\0\1z"s, "\x5F\x10\x01z"}))
                .value,
            PropertyListValue(PropertyListArray{-3, 1.5, Bytes{'z'}, "z"}));
}

TEST(BinaryPropertyListTest, EverySizeOfOffsetsAndReferencesInAnyOrderIsRead) {
  for (std::size_t size = 1; size <= 8; ++size) {
    const std::string array = "\xA3" + number(0, size) + number(2, size) + number(2, size);
    const std::string entry = "\xD1" + number(0, size) + number(1, size);
    EXPECT_EQ(describe(*read(file({"\x51k", array, "\x10\7", entry, "junk"}, size, size, 3)).value),
              "{\n    k = (\n        k,\n        7,\n        7\n    );\n}");
  }
  const PropertyListReading repeated = read(file({"\xD2\1\2\3\4", "\x51k", "\x51k", "\x10\1", "\x10\2"}));
  EXPECT_EQ(describe(*repeated.value), "{\n    k = 2;\n}") << "the last value under a key stays";
  const PropertyListReading shared = read(file({"\xA2\1\1", "\xA1\2", "\x54text"}));
  EXPECT_EQ(shared.value->asArray()->at(0).asArray(), shared.value->asArray()->at(1).asArray());
}

TEST(BinaryPropertyListTest, MalformedFilesAreRefusedWithThePlace) {
  const std::string good = file({"\xA1\1", "\x51x"});
  EXPECT_EQ(read("bplist00").error, "byte 8: too short for a trailer");
  EXPECT_EQ(read("bplist01" + good.substr(8)).error, "byte 0: \"bplist00\" expected");
  // A byte of the good file by its distance from the end, what it becomes, where the error is then.
  using Damage = std::array<std::size_t, 3>;
  for (const auto& [fromEnd, byte, place] :
       listOf<Damage>(Damage{26, 0, 20}, Damage{26, 9, 20}, Damage{25, 0, 21}, Damage{25, 9, 21},
                      Damage{24, 127, 22}, Damage{17, 3, 22}, Damage{9, 2, 30}, Damage{1, 7, 38},
                      Damage{1, 15, 38}, Damage{8, 255, 38}, Damage{34, 7, 12}, Damage{33, 12, 13})) {
    std::string damaged = good;
    damaged[good.size() - fromEnd] = static_cast<char>(byte);
    EXPECT_THAT(read(damaged).error, StartsWith("byte " + std::to_string(place) + ": ")) << fromEnd;
  }
  for (const std::string& object : listOf<std::string>(
           "\0"s, "\x24\0"s, "\x32\0\0\0\0"s, "\xF0", "\x15", "\x14" + number(1, 8) + number(0, 8),
           "\x14" + number(UINT64_MAX, 8) + number(0, 8), "\x52z", "\x62\0z\0"s,
           "\xAF\x13\x7F" + number(UINT64_MAX, 7), "\xDF\x13\x40" + number(0, 7),
           "\x5F\x13" + number(UINT64_MAX, 8), "\x51\x80", "\x61\xD8\0"s)) {
    EXPECT_THAT(read(file({object})).error, StartsWith("byte 8: ")) << testing::PrintToString(object);
  }
  EXPECT_EQ(read(file({})).error, "byte 24: reference to an object that is not there");
  EXPECT_EQ(read(file({"\x5F\x23"})).error, "byte 9: count expected");
  EXPECT_EQ(read(file({"\xA2\1\2", "\x41z", "\xD1\1\1"})).error, "byte 14: a key that is not a string");
  EXPECT_EQ(read(file({"\xA1\0"s})).error, "byte 9: a container that contains itself");
  EXPECT_EQ(read(file({"\xD1\1\2", "\x51k", "\xA1\0"s})).error, "byte 14: a container that contains itself");
}

TEST(BinaryPropertyListTest, DepthAndExpandedSizeAreLimited) {
  const auto nested = [](std::size_t levels) {
    std::vector<std::string> objects;
    for (std::size_t i = 1; i < levels; ++i) objects.push_back("\xA1" + number(i, 4));
    objects.push_back("\xA0");
    return file(objects, 4, 4);
  };
  EXPECT_EQ(read(nested(512)).value->depth(), 512U);
  EXPECT_THAT(read(nested(1'000'000)).error, HasSubstr("nested deeper than 512 levels"));
  EXPECT_EQ(read(nested(3), {2, std::nullopt}).error, "byte 18: nested deeper than 2 levels");
  // The deep part is decoded first, where it is shallow enough, and then referred to from further below.
  const std::string shared = file({"\xA2\1\3", "\xA1\2", "\xA0", "\xA1\1"});
  EXPECT_THAT(read(shared, {3, std::nullopt}).error, HasSubstr("nested deeper than 3 levels"));

  const std::string bytes = file({"\xD1\1\2", "\x53key", "\xA2\3\3", "\x54text"});
  const std::uint64_t expanded = read(bytes).value->expandedSize();
  EXPECT_EQ(read(bytes, {.expandedSize = expanded}).error, "");
  EXPECT_THAT(read(bytes, {.expandedSize = expanded - 1}).error, HasSubstr("the value expands to more than"));
}

TEST(BinaryPropertyListTest, SharingThatMultipliesIsRefusedBeforeItCostsTime) {
  std::vector<std::string> doubling;
  for (char level = 1; level < 100; ++level) doubling.push_back("\xA2"s + level + level);
  doubling.push_back("\xA0");
  EXPECT_THAT(read(file(doubling, 2)).error, HasSubstr("the value expands to more than"));

  // 100,000 objects that all lie at one place: a string of a megabyte, or an array of 100,000 elements.
  constexpr std::size_t count = 100'000;
  std::string top = "\xAF\x12" + number(count, 4), array = top;
  for (std::size_t i = 0; i < count; ++i) {
    top += number(2 + i, 3);
    array += number(1, 3);
  }
  for (const std::string& object : {"\x5F\x12\0\x10\0\0"s + std::string(1 << 20, 'x'), array}) {
    std::vector<std::string> objects(2 + count);
    objects[0] = top;
    objects[1] = "\x08";
    objects.back() = object;
    EXPECT_THAT(read(file(objects, 4, 3)).error, HasSubstr("the value expands to more than"));
  }
}

TEST(BinaryPropertyListTest, DamageNeverReadsOutOfBounds) {
  std::mt19937 random(7);
  for (int round = 0; round < 8; ++round) {
    const std::string bytes = write(randomValue(random, 2));
    for (std::size_t i = 0; i < bytes.size(); i += 1 + bytes.size() / 1500) {
      EXPECT_NE(read(std::string_view(bytes).substr(0, i)).error, "") << "cut to " << i;
      for (const int flip : {0x01, 0x10, 0x80, 0xFF}) {
        std::string damaged = bytes;
        damaged[i] = static_cast<char>(damaged[i] ^ flip);
        const PropertyListReading reading = read(damaged);
        EXPECT_NE(reading.value.has_value(), !reading.error.empty());
      }
    }
  }
}

TEST(BinaryPropertyListTest, EqualPartsOfOneKindAreStoredOnceAndContainersEach) {
  const PropertyListValue shared(PropertyListArray{"x"});
  EXPECT_EQ(write(PropertyListArray{1, 1.0, true, "x", 1, 1.0, true, "x", Bytes{1}, Bytes{1},
                                    PropertyListDate{1}, PropertyListDate{1}, shared, shared}),
            file({"\xAE\1\2\3\4\1\2\3\4\5\5\6\6\7\x08", "\x10\1", "\x23\x3F\xF0\0\0\0\0\0\0"s, "\x09",
                  "\x51x", "\x41\1", "\x33\x3F\xF0\0\0\0\0\0\0"s, "\xA1\4", "\xA1\4"}));
  EXPECT_EQ(write(dictionary({{"y", "x"}, {"x", false}})), file({"\xD2\1\2\3\1", "\x51x", "\x51y", "\x08"}));
}

TEST(BinaryPropertyListTest, ReferencesAndOffsetsGrowWithTheFile) {
  for (const unsigned count : {255U, 256U, 65535U, 65536U}) {
    PropertyListArray array;
    while (array.size() < count) array.emplace_back(array.size());
    const std::string bytes = write(array);
    EXPECT_EQ(bytes[bytes.size() - 25], count < 256 ? 1 : count < 65536 ? 2 : 4) << count;
    EXPECT_EQ(bytes[bytes.size() - 26], count < 65535 ? 2 : 4) << count;
    EXPECT_EQ(read(bytes).value, PropertyListValue(array));
  }
}

TEST(BinaryPropertyListTest, WhatIsWrittenReadsBackAndDependsOnTheContentsAlone) {
  std::mt19937 random(1);
  for (int round = 0; round < 200; ++round) {
    std::mt19937 same = random;
    const PropertyListValue value = randomValue(random, 3);
    const std::string bytes = write(value);
    const PropertyListReading reading = read(bytes);
    ASSERT_EQ(reading.value, value) << reading.error;
    ASSERT_EQ(write(*reading.value), bytes);
    ASSERT_EQ(write(randomValue(same, 3)), bytes);

    const PropertyListPieces pieces = writeBinaryPropertyListPieces(value);
    std::string joined;
    for (const SharedSlice& piece : pieces.pieces) joined.append(piece.view().begin(), piece.view().end());
    ASSERT_EQ(joined, bytes);
    ASSERT_EQ(pieces.size, bytes.size());

    const std::string text = describe(value);
    ASSERT_EQ(describe(readTextPropertyList(Bytes(text.begin(), text.end())).value.value()), text);
  }
  const auto large = std::make_shared<const Bytes>(100'000);
  EXPECT_EQ(writeBinaryPropertyListPieces(PropertyListArray{"x", large, "y"}).pieces.at(1).bytes, large);
}

TEST(BinaryPropertyListTest, ValuesThatNoReaderAcceptsAreNotWritten) {
  PropertyListValue deep = PropertyListArray{};
  for (int level = 1; level < 512; ++level) deep = PropertyListArray{deep};
  EXPECT_EQ(read(write(deep)).value, deep);
  deep = PropertyListArray{deep};
  EXPECT_EQ(writeBinaryPropertyListPieces(deep).error, "the value nests deeper than 512 levels");
  PropertyListValue large = "x";
  for (int level = 0; level < 40; ++level) large = PropertyListArray{large, large};
  EXPECT_EQ(writeBinaryPropertyList(large).error, "the value expands to more than 1073741824 bytes");
}

}  // namespace
}  // namespace kel::platform
