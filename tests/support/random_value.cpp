#include "support/random_value.h"

#include <algorithm>
#include <bit>
#include <cstdint>

namespace kel::platform {

namespace {

std::string randomText(std::mt19937& random) {
  static const std::vector<std::string> parts = {"a",      "Key",    "/",          "//",   " ",    "\"",
                                                 "\\",     "\n",     "\r",         "\t",   "\x1b", "\x7f",
                                                 "\u00e9", "\u4f60", "\U0001F600", "$-_.:"};
  std::string text;
  for (auto count = random() % 6; count > 0; --count) text += parts[random() % parts.size()];
  if (random() % 16 == 0) text.append(random() % 400, 'x');
  return text;
}

std::uint64_t randomBits(std::mt19937& random) {
  return (static_cast<std::uint64_t>(random()) << 32 | random()) >> random() % 64;
}

PropertyListValue randomLeaf(std::mt19937& random) {
  switch (random() % 7) {
    case 0:
      return random() % 2 == 0;
    case 1:
      return randomBits(random);
    case 2:
      return static_cast<std::int64_t>(randomBits(random));
    case 3:
      return std::bit_cast<double>(randomBits(random));
    case 4:
      return Bytes(random() % (random() % 8 == 0 ? 10000 : 20), static_cast<std::uint8_t>(random()));
    case 5:
      return PropertyListDate{static_cast<double>(random()) * 4.5 - 9e9};
    default:
      return randomText(random);
  }
}

}  // namespace

PropertyListValue randomValue(std::mt19937& random, int depth) {
  if (depth == 0 || random() % 4 == 0) return randomLeaf(random);
  const auto count = random() % 20;
  if (random() % 2 == 0) {
    PropertyListArray array;
    for (unsigned i = 0; i < count; ++i) array.push_back(randomValue(random, depth - 1));
    return array;
  }
  PropertyListDictionaryBuilder dictionary;
  for (unsigned i = 0; i < count; ++i) dictionary.set(randomText(random), randomValue(random, depth - 1));
  return dictionary.build();
}

PropertyListValue deepCopy(const PropertyListValue& value) {
  if (const std::string* string = value.asString()) return *string;
  if (const SharedBytes* data = value.asData()) return Bytes(**data);
  if (const PropertyListArray* array = value.asArray()) {
    PropertyListArray copy;
    for (const PropertyListValue& element : *array) copy.push_back(deepCopy(element));
    return copy;
  }
  if (const PropertyListDictionary* dictionary = value.asDictionary()) {
    std::vector<PropertyListDictionary::Entry> copy;
    for (const auto& [key, element] : *dictionary) copy.emplace_back(key.text(), deepCopy(element));
    std::reverse(copy.begin(), copy.end());
    return PropertyListDictionary(std::move(copy));
  }
  return value;
}

}  // namespace kel::platform
