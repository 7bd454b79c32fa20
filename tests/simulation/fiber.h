#pragma once

#include <functional>
#include <memory>

namespace kel::simulation {

/// A call that can be left in the middle and gone on with later: its own stack, on the one thread there is.
class Fiber {
 public:
  /// Nothing runs before `resume`. `body` may not throw.
  explicit Fiber(std::function<void()> body);
  ~Fiber();  ///< after the end of the body
  Fiber(const Fiber&) = delete;
  Fiber& operator=(const Fiber&) = delete;

  /// Runs the body until it suspends or ends. Not from a fiber.
  void resume();

  /// Goes back to where the running fiber was resumed.
  static void suspend();

  bool hasEnded() const;

 private:
  struct Context;
  const std::unique_ptr<Context> context_;
};

}  // namespace kel::simulation
