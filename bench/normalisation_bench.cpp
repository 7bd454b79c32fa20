// How many declared services per second become public service dictionaries, and how fast a whole list is
// written.

#include <benchmark/benchmark.h>
#include <string>
#include <utility>
#include <vector>

#include "entries/app_entry.h"
#include "platform/linux/linux_platform.h"
#include "property_lists/property_list.h"

namespace {

using kel::platform::PropertyListArray;
using kel::platform::PropertyListDictionary;
using kel::platform::PropertyListDictionaryBuilder;

kel::platform::Platform& platform() {
  static kel::platform::LinuxPlatform linuxPlatform;
  return linuxPlatform.platform();
}

PropertyListDictionary dictionary(std::vector<PropertyListDictionary::Entry> entries) {
  return PropertyListDictionary(std::move(entries));
}

std::shared_ptr<kel::KELAppEntry> entryWithServices(std::int64_t count) {
  PropertyListArray services;
  PropertyListDictionaryBuilder german;
  for (std::int64_t i = 0; i < count; ++i) {
    const std::string title = "Command " + std::to_string(i);
    services.emplace_back(dictionary({{"QVMenuItem", dictionary({{"default", title}})},
                                      {"QVKeyEquivalent", dictionary({{"default", "k"}})},
                                      {"QVMessage", "perform"},
                                      {"QVPortName", "Bundle"},
                                      {"QV Send Types", PropertyListArray{"text/plain", "text/rtf"}},
                                      {"QVReturnTypes", PropertyListArray{"text/plain"}},
                                      {"QVUserData", "user:" + std::to_string(i)},
                                      {"QVIcon", "dropped"}}));
    german.set(title, "Befehl " + std::to_string(i));
  }
  const PropertyListDictionary cached =
      dictionary({{"bundle_id", "org.example.bundle"},
                  {"service_dicts", std::move(services)},
                  {"loc_to_menu_strings", dictionary({{"German", german.build()}, {"French", false}})}});
  return kel::KELAppEntry::initFromCacheRepresentation(platform(), cached,
                                                       "/home/u/Library/Services/b.service");
}

void BM_Normalise(benchmark::State& state) {
  const auto entry = entryWithServices(state.range(0));
  for (auto _ : state) {
    std::vector<PropertyListDictionaryBuilder> services;
    entry->addPublicDictionariesForServices(services);
    benchmark::DoNotOptimize(services.data());
  }
  state.SetItemsProcessed(state.iterations() * state.range(0));
}
BENCHMARK(BM_Normalise)->Arg(3)->Arg(300)->Arg(30'000)->Unit(benchmark::kMicrosecond);

void BM_NormaliseBuildAndWriteTheList(benchmark::State& state) {
  const auto entry = entryWithServices(state.range(0));
  for (auto _ : state) {
    std::vector<PropertyListDictionaryBuilder> services;
    entry->addPublicDictionariesForServices(services);
    PropertyListArray list;
    for (const PropertyListDictionaryBuilder& service : services) list.emplace_back(service.build());
    const auto written = kel::platform::writeBinaryPropertyList(list);
    benchmark::DoNotOptimize(written.bytes->data());
  }
  state.SetItemsProcessed(state.iterations() * state.range(0));
}
BENCHMARK(BM_NormaliseBuildAndWriteTheList)->Arg(300)->Arg(30'000)->Unit(benchmark::kMicrosecond);

}  // namespace
