#include "support/sandbox.h"

#include <fcntl.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <sstream>
#include <stdexcept>

#include "keymgr_build_config.h"

extern char** environ;

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
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  out.write(bytes.data(), static_cast<std::streamsize>(bytes.size()));
  if (!out) {
    throw std::runtime_error("cannot write " + path);
  }
}

std::optional<std::string> ReadFile(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  if (!in) {
    return std::nullopt;
  }
  return std::string(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
}

bool Exists(const std::string& path) {
  return fs::exists(path);
}

void MakeEeprom(std::uint8_t control, std::uint32_t sfeConf) {
  std::string image(kEepromSize, '\xFF');
  image[kControlByteOffset] = static_cast<char>(control);
  for (int i = 0; i < 4; ++i) {
    image[kSfeConfOffset + i] = static_cast<char>((sfeConf >> (8 * i)) & 0xFF);
  }
  WriteFile(KEYMGR_EEPROM_PATH, image);
}

std::vector<std::uint8_t> ReadEepromBytes(std::uint32_t offset, std::uint32_t length) {
  auto image = ReadFile(KEYMGR_EEPROM_PATH);
  if (!image || image->size() < offset + length) {
    throw std::runtime_error("EEPROM image missing or short");
  }
  return {image->begin() + offset, image->begin() + offset + length};
}

void WriteEepromBytes(std::uint32_t offset, const std::vector<std::uint8_t>& bytes) {
  std::fstream f(KEYMGR_EEPROM_PATH, std::ios::binary | std::ios::in | std::ios::out);
  f.seekp(offset);
  f.write(reinterpret_cast<const char*>(bytes.data()), static_cast<std::streamsize>(bytes.size()));
  if (!f) {
    throw std::runtime_error("cannot patch the EEPROM image");
  }
}

RunResult Run(const std::vector<std::string>& argv, const std::string& cwd) {
  char outName[] = "/tmp/keymgr-run-out-XXXXXX";
  char errName[] = "/tmp/keymgr-run-err-XXXXXX";
  int outFd = mkstemp(outName);
  int errFd = mkstemp(errName);
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_addopen(&actions, 0, "/dev/null", O_RDONLY, 0);
  posix_spawn_file_actions_adddup2(&actions, outFd, 1);
  posix_spawn_file_actions_adddup2(&actions, errFd, 2);
  if (!cwd.empty()) {
    posix_spawn_file_actions_addchdir_np(&actions, cwd.c_str());
  }
  std::vector<char*> args;
  for (const auto& a : argv) {
    args.push_back(const_cast<char*>(a.c_str()));
  }
  args.push_back(nullptr);
  pid_t pid = -1;
  RunResult result;
  if (posix_spawn(&pid, args[0], &actions, nullptr, args.data(), environ) == 0) {
    int wstatus = 0;
    waitpid(pid, &wstatus, 0);
    result.status = WIFEXITED(wstatus) ? WEXITSTATUS(wstatus) : -1;
  }
  posix_spawn_file_actions_destroy(&actions);
  close(outFd);
  close(errFd);
  result.out = ReadFile(outName).value_or("");
  result.err = ReadFile(errName).value_or("");
  unlink(outName);
  unlink(errName);
  return result;
}

std::string Hex(std::string_view bytes) {
  std::string text;
  char buf[4];
  for (unsigned char c : bytes) {
    std::snprintf(buf, sizeof(buf), "%02X ", c);
    text += buf;
  }
  return text;
}

}  // namespace keymgr::test
