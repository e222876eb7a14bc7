#include "support/tpm_proxy.h"

#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <array>
#include <tuple>
#include <utility>

#include "util/endian.h"

namespace keymgr::test {

namespace {

constexpr std::size_t kHeaderSize = 10;    // tag, size, code
constexpr std::uint32_t kFailure = 0x101;  // TPM_RC_FAILURE

int UnixSocket(const std::string& path, bool listening) {
  const int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::snprintf(address.sun_path, sizeof(address.sun_path), "%s", path.c_str());
  const auto* at = reinterpret_cast<const sockaddr*>(&address);
  if (listening) {
    unlink(path.c_str());
  }
  if (listening ? bind(fd, at, sizeof(address)) == 0 && listen(fd, 16) == 0
                : connect(fd, at, sizeof(address)) == 0) {
    return fd;
  }
  close(fd);
  return -1;
}

std::uint32_t Big(const char* p) {
  return LoadBig32(reinterpret_cast<const std::uint8_t*>(p));
}

// ReadMessage reads one command or response whole.
bool ReadMessage(int fd, std::string& message) {
  std::array<char, 4096> buffer{};
  std::size_t have = 0;
  for (std::size_t want = kHeaderSize; have < want;) {
    const ssize_t got = read(fd, buffer.data() + have, want - have);
    if (got <= 0) {
      return false;
    }
    have += static_cast<std::size_t>(got);
    if (have == kHeaderSize && ((want = Big(buffer.data() + 2)) < kHeaderSize || want > 4096)) {
      return false;
    }
  }
  message.assign(buffer.data(), have);
  return true;
}

bool WriteMessage(int fd, const std::string& message) {
  return send(fd, message.data(), message.size(), MSG_NOSIGNAL) ==
         static_cast<ssize_t>(message.size());
}

}  // namespace

TpmProxy::TpmProxy(const std::string& listen, const std::string& upstream, std::FILE* log)
    : listener_(UnixSocket(listen, true)), upstream_(upstream), log_(log) {
  thread_ = std::thread([this] { Serve(); });
}

TpmProxy::~TpmProxy() {
  shutdown(listener_, SHUT_RDWR);
  thread_.join();
  close(listener_);
  close(held_);
}

void TpmProxy::Arm(Fault fault, int nth, std::uint32_t code) {
  const std::lock_guard<std::mutex> guard(lock_);
  std::tie(fault_, nth_, code_) = std::tuple(fault, nth, code);
  sent_.clear();
  traffic_.clear();
}

void TpmProxy::Rewrite(const std::string& from, const std::string& to) {
  const std::lock_guard<std::mutex> guard(lock_);
  std::tie(from_, to_) = std::tuple(from, to);
}

std::vector<TpmProxy::Command> TpmProxy::Sent() {
  const std::lock_guard<std::mutex> guard(lock_);
  return sent_;
}

std::string TpmProxy::Traffic() {
  const std::lock_guard<std::mutex> guard(lock_);
  return traffic_;
}

void TpmProxy::Serve() {
  for (int client; (client = accept(listener_, nullptr, nullptr)) >= 0;) {
    close(std::exchange(held_, -1));
    Relay(client);
  }
}

// Relay passes the commands of one connection on, one at a time.
void TpmProxy::Relay(int client) {
  std::string message;
  while (ReadMessage(client, message)) {
    const Command command{Big(&message[6]), message.size() >= 14 ? Big(&message[10]) : 0};
    Fault fault = Fault::kNone;
    {
      const std::lock_guard<std::mutex> guard(lock_);
      sent_.push_back(command);
      traffic_ += message;
      const bool hit = nth_ != 0 ? static_cast<int>(sent_.size()) == nth_ : command.code == code_;
      fault = hit ? fault_ : Fault::kNone;
      if (const std::size_t at = from_.empty() ? std::string::npos : message.find(from_);
          at != std::string::npos) {
        message.replace(at, from_.size(), to_);
      }
    }
    if (log_ != nullptr) {
      std::fprintf(log_, "%03X %08X\n", command.code, command.handle);
      std::fflush(log_);
    }
    if (fault == Fault::kHangUp) {
      break;
    }
    if (fault == Fault::kError) {
      const char failed[] = {'\x80', 1, 0, 0, 0, kHeaderSize, 0, 0, kFailure >> 8, kFailure & 0xFF};
      if (!WriteMessage(client, std::string(failed, sizeof(failed)))) {
        break;
      }
      continue;
    }
    const int server = UnixSocket(upstream_, false);
    const bool answered =
        server >= 0 && WriteMessage(server, message) && ReadMessage(server, message);
    close(server);
    if (fault == Fault::kWithhold) {
      held_ = client;
      return;
    }
    if (!answered || !WriteMessage(client, message)) {
      break;
    }
    const std::lock_guard<std::mutex> guard(lock_);
    traffic_ += message;
  }
  close(client);
}

}  // namespace keymgr::test
