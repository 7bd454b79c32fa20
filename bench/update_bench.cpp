// Whole updates over the corpus that KEL_BENCH_CORPUS names, in a scratch home beside it: cold, after a
// restart from the cache file, and when nothing changed.

#include <benchmark/benchmark.h>
#include <cstdlib>
#include <filesystem>
#include <functional>
#include <memory>
#include <string>

#include "common/common.h"
#include "datastore/data_store.h"
#include "platform/linux/linux_platform.h"

namespace {

namespace fs = std::filesystem;

/// A home whose services and applications are the corpus, gone again at the end.
class ScratchHome {
 public:
  explicit ScratchHome(const std::string& corpus) : home_(fs::path(corpus).concat(".home")) {
    fs::remove_all(home_);
    fs::create_directories(home_ / "Library");
    fs::create_directories(home_ / "run");
    fs::permissions(home_ / "run", fs::perms::owner_all);
    fs::create_directory_symlink(fs::path(corpus) / "Library/Services", home_ / "Library/Services");
    fs::create_directory_symlink(fs::path(corpus) / "Applications", home_ / "Applications");
    for (const auto& [name, folder] : {std::pair{"HOME", ""},
                                       {"XDG_CACHE_HOME", "cache"},
                                       {"XDG_RUNTIME_DIR", "run"},
                                       {"XDG_STATE_HOME", "state"},
                                       {"XDG_CONFIG_HOME", "config"}}) {
      setenv(name, (home_ / folder).c_str(), 1);
    }
  }
  ~ScratchHome() { fs::remove_all(home_); }

 private:
  const fs::path home_;
};

/// The platform in a scratch home; null, with the state marked, when no corpus is named.
kel::platform::Platform* platform(benchmark::State& state) {
  const char* corpus = std::getenv("KEL_BENCH_CORPUS");
  if (!corpus) {
    state.SkipWithError("KEL_BENCH_CORPUS names no corpus");
    return nullptr;
  }
  static const ScratchHome home{corpus};
  static kel::platform::LinuxPlatform linuxPlatform;
  static const bool isWatching [[maybe_unused]] = [] {
    kel::platform::Platform& made = linuxPlatform.platform();
    made.journal.watch(kel::explicit_service_directories(made.directories));
    return true;
  }();
  return &linuxPlatform.platform();
}

void report(benchmark::State& state, kel::KELDataStore& store) {
  const auto services = static_cast<double>(store.currentPublicDictionaries().asArray()->size());
  state.counters["services"] = services;
  state.counters["services/s"] = benchmark::Counter(services, benchmark::Counter::kIsIterationInvariantRate);
}

using Work = void (*)(kel::KELDataStore&);

void updateEverything(kel::KELDataStore& store) {
  store.updateServicesCache(kel::KELStaleEverything);
  benchmark::DoNotOptimize(store.currentPublicDictionaries());
}

/// Times `work` on a new store, without a cache file, each time; `before` is not timed.
void measureOnNewStores(benchmark::State& state, Work before, Work work) {
  kel::platform::Platform* services = platform(state);
  if (!services) return;
  std::unique_ptr<kel::KELDataStore> store;
  for (auto _ : state) {
    state.PauseTiming();
    if (store) store->flushCaches();
    store = kel::KELDataStore::initWithSystemServices(*services);
    before(*store);
    state.ResumeTiming();
    work(*store);
  }
  report(state, *store);
}

/// Times `work` again and again on one store that has everything and its cache file.
void measureOnAFullStore(benchmark::State& state, const std::function<void(kel::KELDataStore&)>& work) {
  kel::platform::Platform* services = platform(state);
  if (!services) return;
  const auto store = kel::KELDataStore::initWithSystemServices(*services);
  updateEverything(*store);
  store->writeCaches();
  for (auto _ : state) work(*store);
  report(state, *store);
}

void BM_ColdUpdate(benchmark::State& state) {
  measureOnNewStores(
      state, [](kel::KELDataStore&) {}, updateEverything);
}
BENCHMARK(BM_ColdUpdate)->Unit(benchmark::kMillisecond)->UseRealTime();

void BM_RestartFromTheCache(benchmark::State& state) {
  measureOnAFullStore(state, [&state](kel::KELDataStore&) {
    const auto restarted = kel::KELDataStore::initWithSystemServices(*platform(state));
    benchmark::DoNotOptimize(restarted->currentPublicDictionaries());
  });
}
BENCHMARK(BM_RestartFromTheCache)->Unit(benchmark::kMillisecond)->UseRealTime();

/// With `flags` as the stale sources: 0 asks nothing anew, 2 asks the journal.
void BM_UpdateWithNothingChanged(benchmark::State& state) {
  measureOnAFullStore(state, [&state](kel::KELDataStore& store) {
    store.updateServicesCache(static_cast<kel::KELStaleCacheFlags>(state.range(0)));
    benchmark::DoNotOptimize(store.currentPublicDictionaries());
  });
}
BENCHMARK(BM_UpdateWithNothingChanged)
    ->ArgName("flags")
    ->Arg(0)
    ->Arg(2)
    ->Unit(benchmark::kMillisecond)
    ->UseRealTime();

void BM_FetchALocalization(benchmark::State& state) {
  measureOnNewStores(state, updateEverything,
                     [](kel::KELDataStore& store) { store.fetchLocalizations({{"German"}}); });
}
BENCHMARK(BM_FetchALocalization)->Unit(benchmark::kMillisecond)->UseRealTime();

/// Making its contents; they are written in the background, and waited for at the end.
void BM_WriteTheCacheFile(benchmark::State& state) {
  measureOnAFullStore(state, [](kel::KELDataStore& store) { store.writeCaches(); });
}
BENCHMARK(BM_WriteTheCacheFile)->Unit(benchmark::kMillisecond)->UseRealTime();

}  // namespace
