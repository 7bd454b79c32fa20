#include "platform/linux/conduit/conduit_listener.h"

#include <algorithm>
#include <cerrno>
#include <fcntl.h>
#include <sys/epoll.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <unistd.h>
#include <utility>

#include "platform/linux/files/files.h"
#include "platform/linux/process/linux_process.h"
#include "platform/linux/queues/serial_queue.h"
#include "platform/linux/queues/while_alive.h"

namespace kel::platform {

namespace {

using namespace std::chrono_literals;

constexpr int acceptsInARow = 16;
constexpr auto restInterval = 1s;

/// A connection takes two descriptors; half of those that the process may have are for the rest of its work.
std::size_t connectionLimit() {
  rlimit limit{};
  if (getrlimit(RLIMIT_NOFILE, &limit) != 0) return 16;
  return static_cast<std::size_t>(std::clamp<rlim_t>(limit.rlim_cur / 4, 16, 4096));
}

OwnedDescriptor spareDescriptor() { return OwnedDescriptor(::open("/dev/null", O_RDONLY | O_CLOEXEC)); }

}  // namespace

ConduitAcceptor::ConduitAcceptor(const ConduitServerContext& context, EndpointSocket endpoint,
                                 ConduitEventHandler handler)
    : context_(context),
      keptLoop_(eventLoop(context.queue).shared_from_this()),
      loop_(*keptLoop_),
      handler_(std::move(handler)),
      mostConnections_(connectionLimit()),
      endpoint_(std::move(endpoint)),
      reserve_(spareDescriptor()) {}

void ConduitAcceptor::open() {
  loop_.assertCurrent();
  if (!endpoint_) return;
  watch_ = loop_.watch(endpoint_->get(), EPOLLIN,
                       whileAlive(weak_from_this(), loop_, &ConduitAcceptor::acceptSome));
  if (!watch_) report(errno);
}

void ConduitAcceptor::close() {
  loop_.assertCurrent();
  watch_.reset();
  endpoint_.reset();
  for (const auto& [age, connection] : std::exchange(connections_, {})) connection->shut();
}

void ConduitAcceptor::acceptSome() {
  for (int i = 0; i < acceptsInARow && endpoint_; ++i) {
    // Where the launcher holds the socket too, the next server finds who still waits in it.
    if (isTerminating()) return rest();
    OwnedDescriptor socket(accept4(endpoint_->get(), nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK));
    if (socket) {
      isShort_ = false;
      admit(std::move(socket));
      continue;
    }
    const int error = errno;
    if (error == EAGAIN || error == EWOULDBLOCK) return;
    // A peer that has gone before its turn is not the socket's fault.
    if (error == EINTR || error == ECONNABORTED) continue;
    if (error != EMFILE && error != ENFILE) {
      report(error);
      return rest();
    }
    switch (giveUpOne()) {
      case Shortage::GaveUpOne:
        continue;
      case Shortage::NobodyWaits:
        return;
      case Shortage::Helpless:
        return rest();
    }
  }
}

ConduitAcceptor::Shortage ConduitAcceptor::giveUpOne() {
  if (!reserve_) reserve_ = spareDescriptor();
  if (!reserve_) return Shortage::Helpless;
  // A connection that nobody can accept keeps the socket ready and its peer waiting: with the descriptor that
  // is kept for this it is accepted to be closed.
  reserve_.reset();
  // The kernel looks for a free number before it looks for a connection: there may be none.
  OwnedDescriptor socket(accept4(endpoint_->get(), nullptr, nullptr, SOCK_CLOEXEC));
  const int error = errno;
  const bool accepted = static_cast<bool>(socket);
  socket.reset();
  reserve_ = spareDescriptor();
  if (!accepted) return error == EAGAIN ? Shortage::NobodyWaits : Shortage::Helpless;
  if (!isShort_) context_.log.write("conduit: out of descriptors: closing new connections unserved");
  isShort_ = true;
  return Shortage::GaveUpOne;
}

void ConduitAcceptor::admit(OwnedDescriptor socket) {
  ucred credentials{};
  socklen_t length = sizeof credentials;
  if (getsockopt(socket.get(), SOL_SOCKET, SO_PEERCRED, &credentials, &length) != 0 ||
      credentials.uid != geteuid()) {
    context_.log.write("conduit: process " + std::to_string(credentials.pid) +
                       ": closing the connection: it runs as another user");
    return;
  }
  if (!makeRoom()) {
    if (!isFull_) context_.log.write("conduit: too many busy connections: closing new ones unserved");
    isFull_ = true;
    return;
  }
  isFull_ = false;
  const std::uint64_t age = ++lastConnection_;
  auto peer = LinuxPeerProcess::ofSocket(socket.get(), credentials.pid);
  const auto connection = std::make_shared<ConduitServerConnection>(
      context_, std::move(socket), std::move(peer),
      whileAlive(weak_from_this(), loop_, &ConduitAcceptor::forget, age));
  if (!connection->open()) return;
  connections_.emplace(age, connection);
  handler_(std::shared_ptr<ConduitConnection>(connection));
}

void ConduitAcceptor::forget(std::uint64_t age) { connections_.erase(age); }

bool ConduitAcceptor::makeRoom() {
  if (connections_.size() < mostConnections_) return true;
  const auto idle = std::find_if(connections_.begin(), connections_.end(),
                                 [](const auto& entry) { return entry.second->isIdle(); });
  if (idle == connections_.end()) return false;
  idle->second->refuse("there are too many");
  return true;
}

void ConduitAcceptor::rest() {
  if (!watch_) return;
  // The socket stays ready, so that watching on would keep the loop busy.
  watch_->setEvents(0);
  context_.clock.after(context_.queue, restInterval,
                       whileAlive(weak_from_this(), loop_, &ConduitAcceptor::resume));
}

void ConduitAcceptor::resume() {
  if (watch_) watch_->setEvents(EPOLLIN);
}

void ConduitAcceptor::report(int error) {
  handler_(ConduitError{ConduitError::Kind::Other, errorText(error)});
}

LinuxConduitListener::LinuxConduitListener(const ConduitServerContext& context, EndpointSocket endpoint,
                                           ConduitEventHandler handler)
    : acceptor_(std::make_shared<ConduitAcceptor>(context, std::move(endpoint), std::move(handler))) {
  context.queue.async(whileAlive(std::weak_ptr(acceptor_), eventLoop(context.queue), &ConduitAcceptor::open));
}

}  // namespace kel::platform
