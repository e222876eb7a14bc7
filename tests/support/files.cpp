#include "support/files.h"

#include <openssl/evp.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>

namespace keymgr::test {

void WriteFile(const std::string& path, std::string_view bytes) {
  const std::filesystem::path folder = std::filesystem::path(path).parent_path();
  std::error_code error;
  std::filesystem::create_directories(folder.empty() ? "." : folder, error);
  // A sandbox that cannot be written leaves nothing to test.
  if (!std::ofstream(path, std::ios::binary).write(bytes.data(), std::ssize(bytes))) {
    std::perror(path.c_str());
    std::abort();
  }
}

std::optional<std::string> ReadFile(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  return in ? std::optional(std::string(std::istreambuf_iterator<char>(in), {})) : std::nullopt;
}

std::string Sha256(std::string_view bytes) {
  std::string digest(32, '\0');
  EVP_Digest(bytes.data(), bytes.size(), reinterpret_cast<unsigned char*>(digest.data()), nullptr,
             EVP_sha256(), nullptr);
  return digest;
}

std::string KeyAuth(std::string bytes) {
  bytes.resize(20);
  std::string hex = Hex(bytes), digest(16, '\0');
  std::erase(hex, ' ');
  EVP_Digest(hex.data(), hex.size(), reinterpret_cast<unsigned char*>(digest.data()), nullptr,
             EVP_md5(), nullptr);
  return digest;
}

void Require(bool holds) {
  if (!holds) {
    std::abort();
  }
}

std::string FromHex(std::string_view hex) {
  std::string bytes;
  for (std::size_t i = 0; i + 1 < hex.size(); i += 2) {
    bytes += static_cast<char>(std::stoi(std::string(hex.substr(i, 2)), nullptr, 16));
  }
  return bytes;
}

std::string Hex(std::string_view bytes) {
  std::string text;
  for (unsigned char c : bytes) {
    text += {"0123456789ABCDEF"[c >> 4], "0123456789ABCDEF"[c & 0x0F], ' '};
  }
  return text;
}

std::string LowerHex(std::string_view bytes) {
  std::string text;
  for (unsigned char c : bytes) {
    text += {"0123456789abcdef"[c >> 4], "0123456789abcdef"[c & 0x0F]};
  }
  return text;
}

}  // namespace keymgr::test
