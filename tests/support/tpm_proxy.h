// A TPM that misbehaves on cue: a relay between the key manager and a TPM
// simulator's socket that can leave one command unanswered, answer it with
// an error code, or hang up on it.
#pragma once

#include <atomic>
#include <cstdint>
#include <cstdio>
#include <mutex>
#include <string>
#include <thread>

namespace keymgr::test {

class TpmProxy {
 public:
  enum class Fault {
    kNone,
    kWithhold,  // the simulator runs the command; its answer never comes
    kError,     // answered with TPM_RC_FAILURE, never sent on
    kHangUp,    // the connection is closed without an answer
  };

  // TpmProxy listens on the unix socket |listen| and relays every command to
  // the simulator at |upstream|. With |log|, it appends a line for each
  // command: its code and its first handle (0 when it has none), in hex.
  TpmProxy(const std::string& listen, const std::string& upstream, std::FILE* log = nullptr);
  ~TpmProxy();
  TpmProxy(const TpmProxy&) = delete;
  TpmProxy& operator=(const TpmProxy&) = delete;

  // Arm counts commands from zero again and gives |fault| to the |nth| one
  // (from 1), or with |nth| 0 to every command whose code is |code|.
  void Arm(Fault fault, int nth, std::uint32_t code = 0);
  // Commands is the number of commands seen since Arm.
  int Commands() const { return seen_; }

 private:
  void Serve();
  void Relay(int client);

  int listener_ = -1;
  std::string upstream_;
  std::FILE* log_;
  std::mutex lock_;  // the fault and the count
  Fault fault_ = Fault::kNone;
  int nth_ = 0;
  std::uint32_t code_ = 0;
  std::atomic<int> seen_{0};
  int held_ = -1;  // the client of a withheld answer, closed at the next
  std::thread thread_;
};

}  // namespace keymgr::test
