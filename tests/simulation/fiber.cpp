#include "simulation/fiber.h"

#include <cstddef>
#include <ucontext.h>
#include <utility>
#include <vector>

#if defined(__has_feature)
#if __has_feature(address_sanitizer)
#define KEL_ANNOTATES_STACKS
#endif
#elif defined(__SANITIZE_ADDRESS__)
#define KEL_ANNOTATES_STACKS
#endif
#ifdef KEL_ANNOTATES_STACKS
#include <sanitizer/common_interface_defs.h>
#endif

namespace kel::simulation {

namespace {

constexpr std::size_t stackSize = 512 * 1024;

using Stack = std::unique_ptr<std::byte[]>;

/// Stacks that were used, for the next fibers: making one costs more than most of what runs on it.
std::vector<Stack>& spareStacks() {
  static std::vector<Stack> spare;
  return spare;
}

Stack takeStack() {
  if (spareStacks().empty()) return std::make_unique_for_overwrite<std::byte[]>(stackSize);
  Stack stack = std::move(spareStacks().back());
  spareStacks().pop_back();
  return stack;
}

/// Tells the address sanitizer that another stack is used from here on.
void announceSwitch([[maybe_unused]] void** left, [[maybe_unused]] const void* bottom,
                    [[maybe_unused]] std::size_t size) {
#ifdef KEL_ANNOTATES_STACKS
  __sanitizer_start_switch_fiber(left, bottom, size);
#endif
}

void noteArrival([[maybe_unused]] void* left, [[maybe_unused]] const void** bottom,
                 [[maybe_unused]] std::size_t* size) {
#ifdef KEL_ANNOTATES_STACKS
  __sanitizer_finish_switch_fiber(left, bottom, size);
#endif
}

}  // namespace

struct Fiber::Context {
  std::function<void()> body;
  Stack stack = takeStack();
  ucontext_t own{};
  ucontext_t resumer{};
  void* ownShadow = nullptr;  // what the address sanitizer keeps of the stack that is left
  void* resumerShadow = nullptr;
  const void* resumerBottom = nullptr;
  std::size_t resumerSize = 0;
  bool hasEnded = false;

  static Context*& running() {
    static Context* context = nullptr;
    return context;
  }

  static void enter() {
    Context& self = *running();
    noteArrival(nullptr, &self.resumerBottom, &self.resumerSize);
    self.body();
    self.body = nullptr;
    self.hasEnded = true;
    announceSwitch(nullptr, self.resumerBottom, self.resumerSize);
    swapcontext(&self.own, &self.resumer);
  }
};

Fiber::Fiber(std::function<void()> body) : context_(std::make_unique<Context>()) {
  context_->body = std::move(body);
  getcontext(&context_->own);
  context_->own.uc_stack.ss_sp = context_->stack.get();
  context_->own.uc_stack.ss_size = stackSize;
  makecontext(&context_->own, &Context::enter, 0);
}

Fiber::~Fiber() { spareStacks().push_back(std::move(context_->stack)); }

void Fiber::resume() {
  Context& to = *context_;
  Context::running() = &to;
  announceSwitch(&to.resumerShadow, to.stack.get(), stackSize);
  swapcontext(&to.resumer, &to.own);
  noteArrival(to.resumerShadow, nullptr, nullptr);
  Context::running() = nullptr;
}

void Fiber::suspend() {
  Context& self = *Context::running();
  announceSwitch(&self.ownShadow, self.resumerBottom, self.resumerSize);
  swapcontext(&self.own, &self.resumer);
  noteArrival(self.ownShadow, &self.resumerBottom, &self.resumerSize);
}

bool Fiber::hasEnded() const { return context_->hasEnded; }

}  // namespace kel::simulation
