#include <cstdlib>
#include <gtest/gtest.h>
#include <string>

#include "simulation/history.h"

namespace kel::simulation {
namespace {

std::uint64_t setting(const char* variable, std::uint64_t otherwise) {
  const char* value = std::getenv(variable);
  return value ? std::stoull(value) : otherwise;
}

constexpr std::uint64_t mostActions = 30;

/// What went wrong in a history, and how it came to that; empty when nothing did.
std::string failureOf(std::uint64_t number, std::uint64_t actions) {
  History history(number, actions);
  try {
    history.run();
    return {};
  } catch (const std::exception& failure) {
    return std::string(failure.what()) + "\n" + history.story();
  }
}

/// As above, of the shortest beginning that fails.
std::string shortestFailureOf(std::uint64_t number) {
  std::string failure;
  for (std::uint64_t actions = 0; actions <= mostActions && failure.empty(); ++actions) {
    failure = failureOf(number, actions);
  }
  return failure;
}

/// KEL_SIMULATION_FIRST=n KEL_SIMULATION_COUNT=1 replays history n.
TEST(SimulationTest, NoChangeIsLostAndEveryAnswerIsRightInRandomHistories) {
  const std::uint64_t first = setting("KEL_SIMULATION_FIRST", 0);
  const std::uint64_t count = setting("KEL_SIMULATION_COUNT", 20000);
  int failures = 0;
  for (std::uint64_t number = first; number < first + count && failures < 10; ++number) {
    if (failureOf(number, mostActions).empty()) continue;
    ++failures;
    ADD_FAILURE() << "history " << number << ": " << shortestFailureOf(number);
  }
}

}  // namespace
}  // namespace kel::simulation
