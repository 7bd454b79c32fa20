// Queries of the application registry over a folder of applications, which is made beside the corpus that
// KEL_BENCH_CORPUS names: with everything remembered, against nothing remembered.

#include <benchmark/benchmark.h>
#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "platform/linux/files/linux_file_system.h"
#include "platform/linux/process/linux_system_log.h"
#include "platform/linux/registry/linux_application_registry.h"

namespace {

namespace fs = std::filesystem;
using namespace kel::platform;

/// `count` applications with the information dictionaries of the corpus, gone again at the end.
class ScratchApplications {
 public:
  ScratchApplications(const fs::path& corpus, std::int64_t count)
      : root_(fs::path(corpus).concat(".registry")) {
    fs::remove_all(root_);
    std::vector<fs::path> examples;
    for (const auto& entry : fs::directory_iterator(corpus / "Applications"))
      examples.push_back(entry.path() / "Info.plist");
    for (std::size_t i = 0; i < static_cast<std::size_t>(count); ++i) {
      const fs::path application = root_ / "Applications" / (std::to_string(i) + ".app");
      fs::create_directories(application);
      fs::copy(examples.at(i % examples.size()), application / "Info.plist");
    }
    // What was changed just now is not remembered.
    std::this_thread::sleep_for(std::chrono::milliseconds(2200));
  }
  ~ScratchApplications() { fs::remove_all(root_); }

  std::string applications() const { return root_ / "Applications/"; }
  std::string state() const { return root_ / "state"; }

 private:
  const fs::path root_;
};

/// Each iteration queries a registry that remembers nothing and then one that reads the database which the
/// first left; only the second query counts as the iteration's time.
void BM_QueryWithEverythingRemembered(benchmark::State& state) {
  const char* corpus = std::getenv("KEL_BENCH_CORPUS");
  if (!corpus) return state.SkipWithError("KEL_BENCH_CORPUS names no corpus");
  const ScratchApplications scratch(corpus, state.range(0));
  LinuxSystemLog log;
  LinuxFileSystem files(log);
  ConcurrentQueue queue;
  const auto secondsOfAQuery = [&] {
    LinuxApplicationRegistry registry(files, log, queue, {scratch.applications()}, scratch.state(), nullptr);
    const auto start = std::chrono::steady_clock::now();
    benchmark::DoNotOptimize(registry.applications(0, 0));
    return std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
  };
  secondsOfAQuery();  // brings the files into memory
  double nothingRemembered = 0;
  double allRemembered = 0;
  for (auto _ : state) {
    fs::remove_all(scratch.state());
    nothingRemembered += secondsOfAQuery();
    const double seconds = secondsOfAQuery();
    allRemembered += seconds;
    state.SetIterationTime(seconds);
  }
  using benchmark::Counter;
  state.counters["nothing remembered"] = Counter(nothingRemembered, Counter::kAvgIterations);
  state.counters["times as fast"] = nothingRemembered / allRemembered;
}
BENCHMARK(BM_QueryWithEverythingRemembered)->Arg(10'000)->Unit(benchmark::kMillisecond)->UseManualTime();

}  // namespace
