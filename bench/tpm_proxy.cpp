// tpm_proxy LISTEN UPSTREAM LOG: a counter on the TPM socket. It accepts
// connections on the unix socket LISTEN, relays each to the swtpm socket
// UPSTREAM, and appends a line to LOG for every command: its code and, for
// TPM2_StartAuthSession, the salting key's handle, both in hex. The simulator
// takes one command per connection, and so does the proxy.
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstdint>
#include <cstdio>
#include <cstring>

namespace {

int Unix(const char* path, bool listening) {
  int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::snprintf(address.sun_path, sizeof(address.sun_path), "%s", path);
  const auto* at = reinterpret_cast<const sockaddr*>(&address);
  if (listening) {
    unlink(path);
    return bind(fd, at, sizeof(address)) == 0 && listen(fd, 16) == 0 ? fd : -1;
  }
  return connect(fd, at, sizeof(address)) == 0 ? fd : (close(fd), -1);
}

std::uint32_t Big(const unsigned char* p) {
  return std::uint32_t{p[0]} << 24 | std::uint32_t{p[1]} << 16 | std::uint32_t{p[2]} << 8 | p[3];
}

// Relay copies both ways until either side closes; the first bytes from the
// client are the command's header and first handle.
void Relay(int client, int server, std::FILE* log) {
  unsigned char head[14];
  std::size_t seen = 0;
  pollfd fds[2] = {{client, POLLIN, 0}, {server, POLLIN, 0}};
  char buffer[8192];
  for (;;) {
    if (poll(fds, 2, -1) <= 0) {
      return;
    }
    for (int i = 0; i < 2; ++i) {
      if ((fds[i].revents & (POLLIN | POLLHUP | POLLERR)) == 0) {
        continue;
      }
      const ssize_t got = read(fds[i].fd, buffer, sizeof(buffer));
      if (got <= 0 || write(fds[1 - i].fd, buffer, static_cast<std::size_t>(got)) != got) {
        return;
      }
      // A command shorter than 14 bytes (TPM2_GetRandom) has no handle.
      for (ssize_t k = 0; i == 0 && k < got && seen < sizeof(head); ++k) {
        head[seen++] = static_cast<unsigned char>(buffer[k]);
        if (seen == sizeof(head) || (seen >= 10 && seen == Big(head + 2))) {
          std::fprintf(log, "%03X %08X\n", Big(head + 6),
                       seen == sizeof(head) ? Big(head + 10) : 0);
          std::fflush(log);
          seen = sizeof(head);
        }
      }
    }
  }
}

}  // namespace

int main(int argc, char** argv) {
  if (argc != 4) {
    std::fprintf(stderr, "usage: tpm_proxy LISTEN UPSTREAM LOG\n");
    return 2;
  }
  const int listener = Unix(argv[1], true);
  if (listener < 0) {
    std::perror("tpm_proxy: listen");
    return 1;
  }
  for (int client; (client = accept(listener, nullptr, nullptr)) >= 0; close(client)) {
    const int server = Unix(argv[2], false);
    std::FILE* log = std::fopen(argv[3], "a");
    if (server >= 0 && log != nullptr) {
      Relay(client, server, log);
    }
    if (log != nullptr) {
      std::fclose(log);
    }
    if (server >= 0) {
      close(server);
    }
  }
  return 0;
}
