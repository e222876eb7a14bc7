#include "support/sandbox.h"

#include <fcntl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <csignal>

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <regex>
#include <stdexcept>

#include "keymgr_build_config.h"
#include "platform/eeprom_map.h"

namespace keymgr::test {

namespace fs = std::filesystem;

std::string Root() {
  return KEYMGR_ROOT;
}

std::string InRoot(std::string_view path) {
  return Root() + std::string(path);
}

void ResetSandbox() {
  fs::create_directories(Root());
  for (const auto& entry : fs::directory_iterator(Root())) {
    if (entry.path().filename() != "run") {
      fs::remove_all(entry.path());
    }
  }
  fs::create_directories(InRoot("/quorvan/hidden"));
  fs::create_directories(InRoot("/quorvan/spool/log"));
}

void ResetDevice(std::uint8_t control, std::uint32_t sfeConf) {
  ResetSandbox();
  MakeEeprom(control, sfeConf);
}

void MakeEeprom(std::uint8_t control, std::uint32_t sfeConf) {
  WriteFile(KEYMGR_EEPROM_PATH, std::string(eeprom::kSize, '\xFF'));
  const auto byte = [&](int shift) { return static_cast<std::uint8_t>(sfeConf >> shift); };
  WriteEepromBytes(eeprom::kControlByteOffset, {control});
  WriteEepromBytes(eeprom::kSfeConfOffset, {byte(0), byte(8), byte(16), byte(24)});
}

// Both throw (std::out_of_range, std::bad_optional_access) on a missing image.
std::vector<std::uint8_t> ReadEepromBytes(std::uint32_t offset, std::uint32_t length) {
  std::string bytes = ReadFile(KEYMGR_EEPROM_PATH).value().substr(offset, length);
  return {bytes.begin(), bytes.end()};
}

void WriteEepromBytes(std::uint32_t offset, const std::vector<std::uint8_t>& bytes) {
  std::string image = ReadFile(KEYMGR_EEPROM_PATH).value();
  WriteFile(KEYMGR_EEPROM_PATH, image.replace(offset, bytes.size(), {bytes.begin(), bytes.end()}));
}

const std::vector<std::string> kEmulator{KEYMGR_TEST_EMULATOR};

bool UnderEmulator() {
  return !kEmulator.empty();
}

// Emulated puts the emulator of a cross build in front of the first argument
// that is a program of this build, also behind a launcher such as strace.
std::vector<std::string> Emulated(std::vector<std::string> argv) {
  const std::vector<std::string>& emulator = kEmulator;
  const auto built = std::find_if(argv.begin(), argv.end(), [](const std::string& arg) {
    return arg.starts_with(KEYMGR_TEST_BINARY_DIR "/");
  });
  if (built != argv.end()) {
    argv.insert(built, emulator.begin(), emulator.end());
  }
  return argv;
}

// Run goes through the shell for its redirections, which then execs argv[0]
// itself, so a signal still shows as -1.
RunResult Run(const std::vector<std::string>& argv) {
  const std::string out = "/tmp/keymgr-run-" + std::to_string(getpid()), err = out + ".err";
  std::string command = "exec";
  for (const auto& arg : Emulated(argv)) {
    command += " '" + std::regex_replace(arg, std::regex("'"), "'\\''") + "'";
  }
  const int wstatus = std::system((command + " </dev/null >" + out + " 2>" + err).c_str());
  RunResult result{WIFEXITED(wstatus) ? WEXITSTATUS(wstatus) : -1, *ReadFile(out), *ReadFile(err)};
  fs::remove(out);
  fs::remove(err);
  return result;
}

// -qq keeps the exit of a thread out of the log: printed while another
// thread is in a traced call, it would split that call's line in two.
std::vector<std::string> Traced(const std::vector<std::string>& options,
                                const std::vector<std::string>& argv) {
  const char* asan = std::getenv("ASAN_OPTIONS");
  std::vector<std::string> args = {
      "env", std::string("ASAN_OPTIONS=") + (asan != nullptr ? asan : "") + ":detect_leaks=0",
      "strace", "-qq", "-f"};
  args.insert(args.end(), options.begin(), options.end());
  args.insert(args.end(), argv.begin(), argv.end());
  return args;
}

// StraceArgs traces with seccomp-bpf: the program stops only at the traced
// calls, which keeps long runs fast.
std::vector<std::string> StraceArgs(std::vector<std::string> options,
                                    const std::vector<std::string>& argv) {
  options.insert(options.begin(), "--seccomp-bpf");
  return Traced(options, argv);
}

// Ended tells whether process |pid| has ended (gone, or a zombie).
bool Ended(pid_t pid) {
  const auto stat = ReadFile("/proc/" + std::to_string(pid) + "/stat");
  return !stat || stat->find(") Z ") != std::string::npos;
}

// strace holds the nth call at its entry, where the log shows it with the
// program's process id. The program gets SIGKILL there, then strace is
// killed: the program leaves its stop with the signal pending, and the
// kernel skips the call. (strace's own signal injection does not work
// together with seccomp-bpf.)
bool RunKilledAt(const std::string& call, int n, const std::vector<std::string>& argv) {
  const std::string log = "/tmp/keymgr-kill-" + std::to_string(getpid());
  const auto args =
      Emulated(StraceArgs({"-o", log, "-e", "trace=" + call, "-e",
                           "inject=" + call + ":delay_enter=60s:when=" + std::to_string(n)},
                          argv));
  fs::remove(log);
  const pid_t strace = fork();
  if (strace == 0) {
    const int null = open("/dev/null", O_RDWR);
    for (int fd : {0, 1, 2}) {
      dup2(null, fd);
    }
    std::vector<char*> raw;
    for (const auto& arg : args) {
      raw.push_back(const_cast<char*>(arg.c_str()));
    }
    raw.push_back(nullptr);
    execvp(raw[0], raw.data());
    _exit(127);
  }
  const std::regex entered("(?:^|\\n)(\\d+) +" + call + "\\(");
  int status = 0;
  pid_t victim = 0;
  while (victim == 0 && waitpid(strace, &status, WNOHANG) == 0) {
    const std::string text = ReadFile(log).value_or("");
    std::sregex_iterator it(text.begin(), text.end(), entered), end;
    for (int seen = 1; it != end && seen < n; ++it, ++seen) {
    }
    if (it != end) {
      victim = std::stoi((*it)[1]);
      kill(victim, SIGKILL);
      kill(strace, SIGKILL);
      waitpid(strace, &status, 0);
      while (!Ended(victim)) {
        usleep(1000);
      }
    } else {
      usleep(1000);
    }
  }
  fs::remove(log);
  return victim != 0;
}

std::string SyncTrace(const std::vector<std::string>& argv) {
  const std::string log = "/tmp/keymgr-strace-" + std::to_string(getpid());
  Run(StraceArgs({"-o", log, "-y", "-e", "trace=fsync,linkat,renameat"}, argv));
  // PID fsync(3</path>) = 0, linkat(...) = 0, renameat(4<dir>, "old", 4<dir>, "new") = 0
  static const std::regex kCall(R"re(\d+ +(\w+)\(\d+<([^>]*)>.*?(?:"([^"]*)"\))? = 0)re");
  std::string summary, line;
  std::ifstream in(log);
  for (std::smatch m; std::getline(in, line);) {
    if (!std::regex_match(line, m, kCall)) {
      continue;
    }
    if (m[1] == "fsync") {
      summary += fs::is_directory(m[2].str()) ? "D " : "F ";
    } else if (m[1] == "linkat") {
      summary += "L ";
    } else {
      summary += "R:" + m[3].str() + " ";
    }
  }
  fs::remove(log);
  return summary;
}

std::string Output(const std::function<void()>& call) {
  testing::internal::CaptureStdout();
  call();
  return testing::internal::GetCapturedStdout();
}

void PowerCycleTpm() {
  const std::string socket = std::string(KEYMGR_TCTI).substr(std::strlen("swtpm:path="));
  EXPECT_EQ(Run({"swtpm_ioctl", "--unix", socket + ".ctrl", "-i"}).status, 0);
  EXPECT_EQ(Run({"tpm2_startup", "-c", "-T", KEYMGR_TCTI}).status, 0);
}

std::set<std::string> PersistentHandles(const std::string& tcti) {
  const RunResult r =
      Run({"tpm2_getcap", "handles-persistent", "-T", tcti.empty() ? KEYMGR_TCTI : tcti});
  static const std::regex kHandle("0x8[0-9a-fA-F]{7}");
  std::set<std::string> handles;
  for (std::sregex_iterator it(r.out.begin(), r.out.end(), kHandle), end; it != end; ++it) {
    handles.insert(it->str());
  }
  return handles;
}

void EvictAllBut(const std::set<std::string>& keep, const std::string& tcti) {
  for (const std::string& handle : PersistentHandles(tcti)) {
    if (keep.count(handle) == 0) {
      Run({"tpm2_evictcontrol", "-C", "o", "-c", handle, "-T", tcti.empty() ? KEYMGR_TCTI : tcti});
    }
  }
}

}  // namespace keymgr::test
