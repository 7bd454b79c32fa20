#include "platform/linux/process/linux_system_log.h"

#include <cerrno>
#include <ctime>
#include <poll.h>
#include <sys/socket.h>
#include <sys/uio.h>
#include <unistd.h>

#include "platform/linux/process/unix_address.h"
#include "property_lists/unicode.h"

// Where a line goes. One datagram to the daemon's socket, without waiting. A daemon that is there but takes
// no more has refused: the line is lost, and counted. Where nobody listens it goes to standard error. A
// daemon that was started again listens on a new socket, while ours is still connected to the dead one and
// only says so when we send; so the first failure makes a new connection, and the second one means that
// nobody is there.
//
// Threads share the connection by pointer: one that replaces it closes nothing under another that is just
// sending.
//
// Standard error may be a terminal that was stopped, or a pipe that nobody reads, and cannot be made
// non-blocking, as others write to it through the same description. So it is asked first, and a line is kept
// short enough for what a pipe takes whole once it says that it is ready.
//
// Losses are taken out of the counter by the next line and put back with it when that is lost too: each is
// told once, by whichever line gets through.
namespace kel::platform {

namespace {

// A whole line stays below the 4096 bytes that a pipe which is ready takes without waiting.
constexpr std::size_t longestText = 3900;
constexpr std::string_view cutMark = "[cut]";

void appendOctal(std::string& text, unsigned char byte) {
  text += '#';
  for (const int shift : {6, 3, 0}) text += static_cast<char>('0' + ((byte >> shift) & 7));
}

std::string header() {
  constexpr int userFacility = 1;
  constexpr int notice = 5;
  const std::time_t now = std::time(nullptr);
  std::tm local{};
  localtime_r(&now, &local);
  char stamp[32] = "";
  std::strftime(stamp, sizeof stamp, "%b %e %H:%M:%S", &local);
  return std::string("<")
      .append(std::to_string(userFacility * 8 + notice))
      .append(">")
      .append(stamp)
      .append(" ");
}

bool writeToStandardError(const std::string& line) {
  pollfd ready{STDERR_FILENO, POLLOUT, 0};
  if (poll(&ready, 1, 0) != 1 || (ready.revents & POLLOUT) == 0) return false;
  return ::write(STDERR_FILENO, line.data(), line.size()) == static_cast<ssize_t>(line.size());
}

}  // namespace

std::string escapedForLog(std::string_view message) {
  std::string text;
  for (std::size_t position = 0; position < message.size();) {
    const std::size_t start = position;
    const std::size_t kept = text.size();
    const char32_t character = nextCharacter(message, position);
    const bool isControl = character < 0x20 || (character >= 0x7f && character < 0xa0);
    const bool isIllFormed = character == 0xfffd && position == start + 1;
    for (const char byte : message.substr(start, position - start)) {
      if (isControl || isIllFormed) {
        appendOctal(text, static_cast<unsigned char>(byte));
      } else {
        text += byte;
      }
    }
    if (text.size() > longestText) {
      text.resize(kept);
      return text.append(cutMark);
    }
  }
  return text;
}

void LinuxSystemLog::write(std::string_view message) {
  if (message.ends_with('\n')) message.remove_suffix(1);
  const std::uint64_t lost = lost_.exchange(0);
  std::string line = "kel[" + std::to_string(getpid()) + "]: " + escapedForLog(message);
  if (lost > 0) line += " [" + std::to_string(lost) + " message(s) before this one were lost]";
  Delivery delivery = deliver(header() + line);
  if (delivery == Delivery::NoDaemon && writeToStandardError(line + "\n")) delivery = Delivery::Delivered;
  if (delivery != Delivery::Delivered) lost_ += lost + 1;
}

LinuxSystemLog::Delivery LinuxSystemLog::deliver(const std::string& datagram) {
  std::shared_ptr<const OwnedDescriptor> connection = socket_.copy();
  // A daemon that was restarted listens on a new socket: the second attempt reaches it.
  for (const bool isRetry : {false, true}) {
    if (!connection || isRetry) {
      connection = connectToDaemon();
      socket_.set(connection);
    }
    if (!connection) return Delivery::NoDaemon;
    ssize_t sent = 0;
    do {
      sent = send(connection->get(), datagram.data(), datagram.size(), MSG_NOSIGNAL | MSG_DONTWAIT);
    } while (sent < 0 && errno == EINTR);
    if (sent >= 0) return Delivery::Delivered;
    if (errno == EAGAIN || errno == ENOBUFS || errno == ENOMEM) return Delivery::Refused;
  }
  return Delivery::NoDaemon;
}

std::shared_ptr<const OwnedDescriptor> LinuxSystemLog::connectToDaemon() {
  const std::optional<UnixAddress> address = unixAddress(socketPath_);
  OwnedDescriptor connection(socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  if (!address || !connection || connect(connection.get(), address->get(), address->length) != 0)
    return nullptr;
  return std::make_shared<const OwnedDescriptor>(std::move(connection));
}

}  // namespace kel::platform
