#include "support/tpm_proxy.h"

#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <array>
#include <cstring>

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
    if (bind(fd, at, sizeof(address)) == 0 && listen(fd, 16) == 0) {
      return fd;
    }
  } else if (connect(fd, at, sizeof(address)) == 0) {
    return fd;
  }
  close(fd);
  return -1;
}

std::uint32_t Big(const std::uint8_t* p) {
  return std::uint32_t{p[0]} << 24 | std::uint32_t{p[1]} << 16 | std::uint32_t{p[2]} << 8 | p[3];
}

// ReadMessage reads one command or response whole into |message|.
bool ReadMessage(int fd, std::array<std::uint8_t, 4096>& message, std::size_t* size) {
  std::size_t have = 0;
  for (std::size_t want = kHeaderSize; have < want;) {
    const ssize_t got = read(fd, message.data() + have, want - have);
    if (got <= 0) {
      return false;
    }
    have += static_cast<std::size_t>(got);
    if (have == kHeaderSize) {
      want = Big(message.data() + 2);
      if (want < kHeaderSize || want > message.size()) {
        return false;
      }
    }
  }
  *size = have;
  return true;
}

bool WriteAll(int fd, const std::uint8_t* bytes, std::size_t size) {
  return send(fd, bytes, size, MSG_NOSIGNAL) == static_cast<ssize_t>(size);
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
  if (held_ >= 0) {
    close(held_);
  }
}

void TpmProxy::Arm(Fault fault, int nth, std::uint32_t code) {
  std::lock_guard<std::mutex> guard(lock_);
  fault_ = fault;
  nth_ = nth;
  code_ = code;
  seen_ = 0;
}

void TpmProxy::Serve() {
  for (int client; (client = accept(listener_, nullptr, nullptr)) >= 0;) {
    if (held_ >= 0) {
      close(held_);
      held_ = -1;
    }
    Relay(client);
  }
}

// Relay passes the commands of one connection on, one at a time.
void TpmProxy::Relay(int client) {
  std::array<std::uint8_t, 4096> message{};
  std::size_t size = 0;
  while (ReadMessage(client, message, &size)) {
    const std::uint32_t code = Big(message.data() + 6);
    if (log_ != nullptr) {
      std::fprintf(log_, "%03X %08X\n", code, size >= 14 ? Big(message.data() + 10) : 0);
      std::fflush(log_);
    }
    Fault fault = Fault::kNone;
    {
      std::lock_guard<std::mutex> guard(lock_);
      const int nth = ++seen_;
      if ((nth_ != 0 && nth == nth_) || (nth_ == 0 && code == code_)) {
        fault = fault_;
      }
    }
    if (fault == Fault::kHangUp) {
      break;
    }
    if (fault == Fault::kError) {
      const std::uint8_t failed[kHeaderSize] = {
          0x80, 0x01, 0, 0, 0, kHeaderSize, 0, 0, kFailure >> 8, kFailure & 0xFF};
      if (!WriteAll(client, failed, sizeof(failed))) {
        break;
      }
      continue;
    }
    const int server = UnixSocket(upstream_, false);
    const bool answered = server >= 0 && WriteAll(server, message.data(), size) &&
                          ReadMessage(server, message, &size);
    if (server >= 0) {
      close(server);
    }
    if (fault == Fault::kWithhold) {
      held_ = client;
      return;
    }
    if (!answered || !WriteAll(client, message.data(), size)) {
      break;
    }
  }
  close(client);
}

}  // namespace keymgr::test
