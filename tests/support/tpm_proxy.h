// A TPM that misbehaves on cue: a relay between the key manager and a TPM
// simulator's socket that keeps what crossed it (the bus as a probe on it
// would see it) and can leave one command unanswered, answer it with an
// error code, hang up on it, or change its bytes on the way.
#pragma once

#include <cstdint>
#include <cstdio>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

namespace keymgr::test {

class TpmProxy {
 public:
  enum class Fault {
    kNone,
    kWithhold,  // the simulator runs the command; its answer never comes
    kError,     // answered with TPM_RC_FAILURE, never sent on
    kHangUp,    // the connection is closed without an answer
  };
  // A command as it was sent: its code and its first handle (0 for none).
  struct Command {
    std::uint32_t code, handle;
  };

  // TpmProxy listens on the unix socket |listen| and relays every command to
  // the simulator at |upstream|, one connection at a time. With |log|, it
  // appends a line for each command: its code and first handle, in hex.
  TpmProxy(const std::string& listen, const std::string& upstream, std::FILE* log = nullptr);
  ~TpmProxy();
  TpmProxy(const TpmProxy&) = delete;
  TpmProxy& operator=(const TpmProxy&) = delete;

  // Arm forgets what was sent and gives |fault| to the |nth| command from
  // now (from 1), or with |nth| 0 to every command whose code is |code|.
  void Arm(Fault fault, int nth, std::uint32_t code = 0);
  // Rewrite replaces |from| by |to| (as long) in every command from now on
  // that holds it, as an interposer on the bus would; an empty |from| stops.
  void Rewrite(const std::string& from, const std::string& to);
  // The commands, and every byte that crossed either way, since Arm.
  std::vector<Command> Sent();
  std::string Traffic();

 private:
  void Serve();
  void Relay(int client);

  int listener_ = -1;
  std::string upstream_;
  std::FILE* log_;
  std::mutex lock_;  // guards the fault and the record
  Fault fault_ = Fault::kNone;
  int nth_ = 0;
  std::uint32_t code_ = 0;
  std::vector<Command> sent_;
  std::string traffic_;
  std::string from_, to_;
  int held_ = -1;  // the client of a withheld answer, closed at the next
  std::thread thread_;
};

}  // namespace keymgr::test
