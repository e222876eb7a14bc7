#include "support/sandbox.h"

#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <regex>
#include <stdexcept>

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

void WriteFile(const std::string& path, std::string_view bytes) {
  fs::create_directories(fs::path(path).parent_path());
  if (!std::ofstream(path, std::ios::binary).write(bytes.data(), std::ssize(bytes))) {
    throw std::runtime_error("cannot write " + path);
  }
}

std::optional<std::string> ReadFile(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  return in ? std::optional(std::string(std::istreambuf_iterator<char>(in), {})) : std::nullopt;
}

bool Exists(const std::string& path) {
  return fs::exists(path);
}

void MakeEeprom(std::uint8_t control, std::uint32_t sfeConf) {
  WriteFile(KEYMGR_EEPROM_PATH, std::string(kEepromSize, '\xFF'));
  const auto byte = [&](int shift) { return static_cast<std::uint8_t>(sfeConf >> shift); };
  WriteEepromBytes(kControlByteOffset, {control});
  WriteEepromBytes(kSfeConfOffset, {byte(0), byte(8), byte(16), byte(24)});
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

// Run goes through the shell for its redirections, which then execs argv[0]
// itself, so a signal still shows as -1.
RunResult Run(const std::vector<std::string>& argv) {
  const std::string out = "/tmp/keymgr-run-" + std::to_string(getpid()), err = out + ".err";
  std::string command = "exec";
  for (const auto& arg : argv) {
    command += " '" + std::regex_replace(arg, std::regex("'"), "'\\''") + "'";
  }
  const int wstatus = std::system((command + " </dev/null >" + out + " 2>" + err).c_str());
  RunResult result{WIFEXITED(wstatus) ? WEXITSTATUS(wstatus) : -1, *ReadFile(out), *ReadFile(err)};
  fs::remove(out), fs::remove(err);
  return result;
}

std::string Hex(std::string_view bytes) {
  std::string text;
  for (unsigned char c : bytes) {
    text += {"0123456789ABCDEF"[c >> 4], "0123456789ABCDEF"[c & 0x0F], ' '};
  }
  return text;
}

}  // namespace keymgr::test
