#include "support/sandbox.h"

#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <regex>

#include "eeprom/eeprom_map.h"
#include "keymgr_build_config.h"

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
  std::string image(eeprom::kSize, '\xFF');
  image[eeprom::kControlByteOffset] = static_cast<char>(control);
  for (int i = 0; i < 4; ++i) {
    image[eeprom::kSfeConfOffset + i] = static_cast<char>(sfeConf >> (8 * i));
  }
  WriteFile(KEYMGR_EEPROM_PATH, image);
}

const std::vector<std::string> kEmulator{KEYMGR_TEST_EMULATOR};

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

std::string SyncTrace(const std::vector<std::string>& argv) {
  const std::string log = "/tmp/keymgr-strace-" + std::to_string(getpid());
  // seccomp-bpf stops the program only at the traced calls, which keeps
  // long runs fast.
  Run(Traced({"--seccomp-bpf", "-o", log, "-y", "-e", "trace=fsync,linkat,renameat"}, argv));
  // PID fsync(3</path>) = 0, linkat(...) = 0, renameat(4<dir>, "old", 4<dir>, "new") = 0
  static const std::regex kCall(R"re(\d+ +(\w+)\(\d+<([^>]*)>.*?(?:"([^"]*)"\))? = 0)re");
  std::string summary, line;
  std::ifstream in(log);
  for (std::smatch m; std::getline(in, line);) {
    if (std::regex_match(line, m, kCall)) {
      summary += m[1] == "linkat"               ? "L "
                 : m[1] == "renameat"           ? "R:" + m[3].str() + " "
                 : fs::is_directory(m[2].str()) ? "D "
                                                : "F ";
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
  EXPECT_EQ(Tpm2({"tpm2_startup", "-c"}).status, 0);
}

RunResult Tpm2(std::vector<std::string> argv) {
  argv.insert(argv.end(), {"-T", KEYMGR_TCTI});
  return Run(argv);
}

std::set<std::string> PersistentHandles() {
  const std::string out = Tpm2({"tpm2_getcap", "handles-persistent"}).out;
  static const std::regex kHandle("0x8[0-9a-fA-F]{7}");
  std::set<std::string> handles;
  for (std::sregex_iterator it(out.begin(), out.end(), kHandle), end; it != end; ++it) {
    handles.insert(it->str());
  }
  return handles;
}

void EvictAllBut(const std::set<std::string>& keep) {
  for (const std::string& handle : PersistentHandles()) {
    if (keep.count(handle) == 0) {
      Tpm2({"tpm2_evictcontrol", "-C", "o", "-c", handle});
    }
  }
}

std::string TpmLeftovers() {
  std::string left;
  for (const char* kind :
       {"handles-transient", "handles-loaded-session", "handles-saved-session"}) {
    left += Tpm2({"tpm2_getcap", kind}).out;
  }
  return left;
}

void FlushTpm() {
  for (const char* kind : {"-t", "-l", "-s"}) {
    Tpm2({"tpm2_flushcontext", kind});
  }
}

}  // namespace keymgr::test
