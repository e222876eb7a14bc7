#include "tpm/socket_tcti.h"

#include <netdb.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <new>
#include <string_view>

#include "util/endian.h"
#include "util/owned.h"

namespace keymgr::tpm {

namespace {

using Clock = std::chrono::steady_clock;

constexpr std::uint64_t kMagic = 0x6b6d67722d746374ull;  // "kmgr-tct"
constexpr std::size_t kHeaderSize = 10;                  // tag, size, code
constexpr std::size_t kMaxResponse = 4096;               // TPM2_MAX_RESPONSE_SIZE

struct SocketTcti {
  TSS2_TCTI_CONTEXT_COMMON_V2 common;  // first, as tpm2-tss reads it
  std::array<char, 108> path{};        // a unix socket, or
  std::array<char, 64> host{};         // a TCP host and port
  std::array<char, 8> port{};
  int deadlineMs = 0;
  Descriptor socket;
  bool receiving = false;
  std::size_t have = 0;  // bytes of the response read so far
  std::array<std::uint8_t, kMaxResponse> response{};
};

SocketTcti* Cast(TSS2_TCTI_CONTEXT* tcti) {
  return IsSocketTcti(tcti) ? reinterpret_cast<SocketTcti*>(tcti) : nullptr;
}

int MillisecondsLeft(Clock::time_point deadline) {
  const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now());
  return left.count() > 0 ? static_cast<int>(left.count()) : 0;
}

// Wait waits for |events| on |fd| until |deadline|.
bool Wait(int fd, short events, Clock::time_point deadline) {
  for (;;) {
    pollfd entry{fd, events, 0};
    const int ready = ::poll(&entry, 1, MillisecondsLeft(deadline));
    if (ready > 0) {
      return true;
    }
    if (ready == 0 || errno != EINTR) {
      return false;
    }
  }
}

// Connect opens a non-blocking connection to the simulator by |deadline|. A
// unix socket whose backlog is full refuses at once (EAGAIN), so it is tried
// again until the deadline.
bool Connect(SocketTcti& tcti, Clock::time_point deadline) {
  if (tcti.path[0] != '\0') {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::memcpy(address.sun_path, tcti.path.data(), sizeof(address.sun_path) - 1);
    for (;;) {
      tcti.socket.reset(::socket(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0));
      if (!tcti.socket) {
        return false;
      }
      if (::connect(tcti.socket.get(), reinterpret_cast<const sockaddr*>(&address),
                    sizeof(address)) == 0) {
        return true;
      }
      if (errno != EAGAIN || MillisecondsLeft(deadline) == 0) {
        return false;
      }
      const timespec pause{0, 10'000'000};
      ::nanosleep(&pause, nullptr);
    }
  }
  addrinfo hints{};
  hints.ai_family = AF_UNSPEC;
  hints.ai_socktype = SOCK_STREAM;
  addrinfo* found = nullptr;
  if (::getaddrinfo(tcti.host.data(), tcti.port.data(), &hints, &found) != 0) {
    return false;
  }
  Owned<addrinfo*, freeaddrinfo> addresses(found);
  for (const addrinfo* at = found; at != nullptr; at = at->ai_next) {
    tcti.socket.reset(::socket(at->ai_family, at->ai_socktype | SOCK_NONBLOCK | SOCK_CLOEXEC, 0));
    if (!tcti.socket) {
      continue;
    }
    int error = 0;
    socklen_t length = sizeof(error);
    if (::connect(tcti.socket.get(), at->ai_addr, at->ai_addrlen) == 0 ||
        (errno == EINPROGRESS && Wait(tcti.socket.get(), POLLOUT, deadline) &&
         ::getsockopt(tcti.socket.get(), SOL_SOCKET, SO_ERROR, &error, &length) == 0 &&
         error == 0)) {
      return true;
    }
  }
  return false;
}

TSS2_RC Transmit(TSS2_TCTI_CONTEXT* context, size_t size, const uint8_t* command) {
  SocketTcti* tcti = Cast(context);
  if (tcti == nullptr || command == nullptr) {
    return TSS2_TCTI_RC_BAD_REFERENCE;
  }
  // The simulator takes one command per connection.
  const Clock::time_point deadline = Clock::now() + std::chrono::milliseconds(tcti->deadlineMs);
  tcti->socket.reset();
  tcti->receiving = false;
  if (!Connect(*tcti, deadline)) {
    return TSS2_TCTI_RC_IO_ERROR;
  }
  for (std::size_t sent = 0; sent < size;) {
    const ssize_t put = ::send(tcti->socket.get(), command + sent, size - sent, MSG_NOSIGNAL);
    if (put > 0) {
      sent += static_cast<std::size_t>(put);
    } else if (put < 0 && (errno == EINTR ||
                           (errno == EAGAIN && Wait(tcti->socket.get(), POLLOUT, deadline)))) {
      continue;
    } else {
      tcti->socket.reset();
      return TSS2_TCTI_RC_IO_ERROR;
    }
  }
  tcti->receiving = true;
  tcti->have = 0;
  return TSS2_RC_SUCCESS;
}

// ResponseSize is the size the response's header gives, once it is in.
std::size_t ResponseSize(const SocketTcti& tcti) {
  if (tcti.have < kHeaderSize) {
    return kHeaderSize;
  }
  return LoadBig32(tcti.response.data() + 2);
}

TSS2_RC Receive(TSS2_TCTI_CONTEXT* context, size_t* size, uint8_t* response, int32_t timeout) {
  SocketTcti* tcti = Cast(context);
  if (tcti == nullptr || size == nullptr) {
    return TSS2_TCTI_RC_BAD_REFERENCE;
  }
  if (!tcti->receiving) {
    return TSS2_TCTI_RC_BAD_SEQUENCE;
  }
  const Clock::time_point deadline =
      Clock::now() + std::chrono::milliseconds(timeout < 0 ? tcti->deadlineMs : timeout);
  // A partial answer stays here for the next call after TRY_AGAIN.
  while (tcti->have < ResponseSize(*tcti)) {
    const std::size_t want = ResponseSize(*tcti);
    if (want < kHeaderSize || want > tcti->response.size()) {
      tcti->socket.reset();
      tcti->receiving = false;
      return TSS2_TCTI_RC_MALFORMED_RESPONSE;
    }
    const ssize_t got =
        ::recv(tcti->socket.get(), tcti->response.data() + tcti->have, want - tcti->have, 0);
    if (got > 0) {
      tcti->have += static_cast<std::size_t>(got);
    } else if (got < 0 && errno == EINTR) {
      continue;
    } else if (got < 0 && errno == EAGAIN) {
      if (!Wait(tcti->socket.get(), POLLIN, deadline)) {
        return TSS2_TCTI_RC_TRY_AGAIN;
      }
    } else {
      tcti->socket.reset();
      tcti->receiving = false;
      return TSS2_TCTI_RC_IO_ERROR;
    }
  }
  const std::size_t total = ResponseSize(*tcti);
  if (response == nullptr || *size < total) {
    *size = total;
    return response == nullptr ? TSS2_RC_SUCCESS : TSS2_TCTI_RC_INSUFFICIENT_BUFFER;
  }
  std::memcpy(response, tcti->response.data(), total);
  *size = total;
  tcti->socket.reset();
  tcti->receiving = false;
  return TSS2_RC_SUCCESS;
}

void Finalize(TSS2_TCTI_CONTEXT* context) {
  if (SocketTcti* tcti = Cast(context); tcti != nullptr) {
    tcti->socket.reset();
  }
}

TSS2_RC NotImplemented(TSS2_TCTI_CONTEXT* /*context*/) {
  return TSS2_TCTI_RC_NOT_IMPLEMENTED;
}

// Copy copies |value| into |out| when it fits with its terminator.
template <std::size_t N>
bool Copy(std::string_view value, std::array<char, N>& out) {
  if (value.empty() || value.size() >= N) {
    return false;
  }
  value.copy(out.data(), value.size());
  return true;
}

// Parse reads "path=P" or "host=H,port=N" (port 2321 when not given).
bool Parse(std::string_view conf, SocketTcti& tcti) {
  bool ok = true;
  std::string_view port = "2321";
  while (!conf.empty() && ok) {
    const std::string_view item = conf.substr(0, conf.find(','));
    conf.remove_prefix(std::min(conf.size(), item.size() + 1));
    if (item.starts_with("path=")) {
      ok = Copy(item.substr(5), tcti.path);
    } else if (item.starts_with("host=")) {
      ok = Copy(item.substr(5), tcti.host);
    } else if (item.starts_with("port=")) {
      port = item.substr(5);
    } else {
      ok = false;
    }
  }
  if (tcti.path[0] == '\0' && tcti.host[0] == '\0') {
    ok = ok && Copy("localhost", tcti.host);
  }
  return ok && (tcti.path[0] != '\0' || Copy(port, tcti.port));
}

}  // namespace

Status InitSocketTcti(const char* conf, int deadlineMs, TSS2_TCTI_CONTEXT** tcti) {
  auto* context = new (std::nothrow) SocketTcti;
  if (context == nullptr) {
    return ErrnoFailure("socket TCTI", ENOMEM);
  }
  if (!Parse(conf != nullptr ? conf : "", *context)) {
    delete context;
    return Refused("socket TCTI configuration");
  }
  context->deadlineMs = deadlineMs;
  TSS2_TCTI_CONTEXT_COMMON_V1& v1 = context->common.v1;
  v1.magic = kMagic;
  v1.version = 2;
  v1.transmit = Transmit;
  v1.receive = Receive;
  v1.finalize = Finalize;
  v1.cancel = NotImplemented;
  v1.getPollHandles = [](TSS2_TCTI_CONTEXT*, TSS2_TCTI_POLL_HANDLE*, size_t*) -> TSS2_RC {
    return TSS2_TCTI_RC_NOT_IMPLEMENTED;
  };
  v1.setLocality = [](TSS2_TCTI_CONTEXT*, uint8_t) -> TSS2_RC {
    return TSS2_TCTI_RC_NOT_IMPLEMENTED;
  };
  context->common.makeSticky = [](TSS2_TCTI_CONTEXT*, TPM2_HANDLE*, uint8_t) -> TSS2_RC {
    return TSS2_TCTI_RC_NOT_IMPLEMENTED;
  };
  *tcti = reinterpret_cast<TSS2_TCTI_CONTEXT*>(context);
  return Status();
}

bool IsSocketTcti(TSS2_TCTI_CONTEXT* tcti) {
  return tcti != nullptr && reinterpret_cast<TSS2_TCTI_CONTEXT_COMMON_V1*>(tcti)->magic == kMagic;
}

void FinalizeSocketTcti(TSS2_TCTI_CONTEXT* tcti) {
  delete Cast(tcti);
}

}  // namespace keymgr::tpm
