// Reads and writes values that resemble information dictionaries; throughput is in bytes of the encoding.
#include <benchmark/benchmark.h>

#include "property_lists/property_list.h"

namespace kel::platform {
namespace {

PropertyListValue service(const std::string& number) {
  PropertyListDictionaryBuilder menuItem;
  menuItem.set("default", "Open Selection " + number);
  PropertyListDictionaryBuilder service;
  service.set("KTMessage", "openSelection" + number);
  service.set("KTMenuItem", menuItem.build());
  service.set("KTPortName", "Application" + number);
  service.set("KTSendTypes", PropertyListArray{"public.utf8-plain-text", "public.html", "public.rtf"});
  service.set("KTReturnTypes", PropertyListArray{"public.utf8-plain-text"});
  service.set("KTTimeout", "30000");
  return service.build();
}

/// `count` information dictionaries of two services each.
PropertyListValue dictionaries(int count) {
  PropertyListArray all;
  for (int i = 0; i < count; ++i) {
    const std::string number = std::to_string(i);
    PropertyListDictionaryBuilder dictionary;
    dictionary.set("KTBundleIdentifier", "org.example.application" + number);
    dictionary.set("KTBundleName", "Application \u00e9 " + number);
    dictionary.set("KTBundleVersion", i);
    dictionary.set("KTBundleExecutable", "Application" + number);
    dictionary.set("KTSupportsSuddenTermination", true);
    dictionary.set("QVServices", PropertyListArray{service(number + "a"), service(number + "b")});
    all.push_back(dictionary.build());
  }
  return all;
}

// Only the kinds that `dictionaries` holds.
void appendXML(std::string& text, const PropertyListValue& value) {
  if (const PropertyListArray* array = value.asArray()) {
    text += "<array>\n";
    for (const PropertyListValue& element : *array) appendXML(text, element);
    text += "</array>\n";
  } else if (const PropertyListDictionary* dictionary = value.asDictionary()) {
    text += "<dict>\n";
    for (const auto& [key, element] : *dictionary) {
      text += "\t<key>" + key.text() + "</key>\n\t";
      appendXML(text, element);
    }
    text += "</dict>\n";
  } else if (const std::string* string = value.asString()) {
    text += "<string>" + *string + "</string>\n";
  } else if (value.asBoolean()) {
    text += *value.asBoolean() ? "<true/>\n" : "<false/>\n";
  } else {
    text += "<integer>" + describe(value) + "</integer>\n";
  }
}

Bytes binary(const PropertyListValue& value) { return *writeBinaryPropertyList(value).bytes; }

Bytes xml(const PropertyListValue& value) {
  std::string text = "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\">\n";
  appendXML(text, value);
  text += "</plist>\n";
  return Bytes(text.begin(), text.end());
}

Bytes text(const PropertyListValue& value) {
  const std::string description = describe(value);
  return Bytes(description.begin(), description.end());
}

void countBytes(benchmark::State& state, std::size_t size) {
  state.SetBytesProcessed(static_cast<std::int64_t>(state.iterations()) * static_cast<std::int64_t>(size));
}

void read(benchmark::State& state, Bytes (*encode)(const PropertyListValue&)) {
  const Bytes bytes = encode(dictionaries(static_cast<int>(state.range())));
  for (auto _ : state) {
    const PropertyListReading reading = readPropertyList(bytes);
    if (!reading.value) state.SkipWithError(reading.error.c_str());
  }
  countBytes(state, bytes.size());
}
BENCHMARK_CAPTURE(read, binary, binary)->Arg(1)->Arg(100)->Arg(10'000);
BENCHMARK_CAPTURE(read, xml, xml)->Arg(1)->Arg(100)->Arg(10'000);
BENCHMARK_CAPTURE(read, text, text)->Arg(1)->Arg(100)->Arg(10'000);

/// Writes a value whose repeated strings are shared, as those that were read are.
void writeBinary(benchmark::State& state) {
  const Bytes bytes = binary(dictionaries(static_cast<int>(state.range())));
  const PropertyListValue value = *readBinaryPropertyList(bytes).value;
  for (auto _ : state) benchmark::DoNotOptimize(writeBinaryPropertyListPieces(value));
  countBytes(state, bytes.size());
}
BENCHMARK(writeBinary)->Arg(1)->Arg(100)->Arg(10'000);

/// The same for a value that shares nothing.
void writeBinaryUnshared(benchmark::State& state) {
  const PropertyListValue value = dictionaries(static_cast<int>(state.range()));
  for (auto _ : state) benchmark::DoNotOptimize(writeBinaryPropertyListPieces(value));
  countBytes(state, binary(value).size());
}
BENCHMARK(writeBinaryUnshared)->Arg(1)->Arg(100)->Arg(10'000);

void describeValue(benchmark::State& state) {
  const PropertyListValue value = dictionaries(static_cast<int>(state.range()));
  for (auto _ : state) benchmark::DoNotOptimize(describe(value));
  countBytes(state, text(value).size());
}
BENCHMARK(describeValue)->Arg(1)->Arg(100)->Arg(10'000);

}  // namespace
}  // namespace kel::platform
