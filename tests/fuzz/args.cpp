// The three programs' command lines from any argument vector (the pieces of
// the input between NUL bytes, each in an allocation of its own so that a
// read past its end is seen): what each parser returns agrees with the
// arguments it was given.
#include <array>
#include <cctype>
#include <cstdint>
#include <cstring>
#include <memory>
#include <vector>

#include "cli/command.h"
#include "support/files.h"
#include "tools/eeprom_args.h"
#include "tools/host_args.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using keymgr::test::Require;
  std::vector<std::unique_ptr<char[]>> pieces;
  const auto add = [&](const char* begin, std::size_t length) {
    pieces.push_back(std::make_unique<char[]>(length + 1));
    std::memcpy(pieces.back().get(), begin, length);
  };
  add("prog", 4);
  const char* text = reinterpret_cast<const char*>(data);
  for (std::size_t start = 0, at = 0; at <= size && pieces.size() < 6; ++at) {
    if (at == size || text[at] == '\0') {
      add(text + start, at - start);
      start = at + 1;
    }
  }
  std::vector<const char*> argv;
  for (const auto& piece : pieces) {
    argv.push_back(piece.get());
  }
  argv.push_back(nullptr);
  const int argc = static_cast<int>(pieces.size());

  using keymgr::cli::Action;
  const keymgr::cli::Command command = keymgr::cli::ParseCommand(argc, argv.data());
  Require(command.path == (command.action == Action::kFile && argc > 2 ? argv[2] : nullptr));
  Require(command.verbose == 0 || command.action == Action::kVerify);

  using Host = keymgr::tools::HostArgs;
  const Host host = keymgr::tools::ParseHostArgs(argc, argv.data());
  Require(host.action != Host::Action::kManage || argc == 2 || argc == 3);
  Require(host.action != Host::Action::kUsage || (host.option == 0 && host.logFlag == 0));

  using Eeprom = keymgr::tools::EepromArgs;
  static std::array<std::uint8_t, keymgr::eeprom::kSize> bytes;
  const Eeprom eeprom = keymgr::tools::ParseEepromArgs(argc, argv.data(), bytes);
  if (eeprom.action == Eeprom::Action::kWrite) {
    // The bytes spell the hex argument, digit for digit.
    const char* hex = argv[3];
    Require(2 * eeprom.length == std::strlen(hex));
    for (std::size_t i = 0; i < eeprom.length && eeprom.length <= bytes.size(); ++i) {
      Require(std::tolower(static_cast<unsigned char>(hex[2 * i])) ==
                  "0123456789abcdef"[bytes[i] >> 4] &&
              std::tolower(static_cast<unsigned char>(hex[2 * i + 1])) ==
                  "0123456789abcdef"[bytes[i] & 15]);
    }
  }
  return 0;
}
