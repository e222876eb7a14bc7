#include "integrity/manifest.h"

#include <openssl/sha.h>

#include <gtest/gtest.h>

#include <cstdio>
#include <filesystem>
#include <string>
#include <vector>

#include "support/sandbox.h"

namespace {

namespace t = keymgr::test;
namespace fs = std::filesystem;

const std::string kDigests = t::InRoot("/quorvan/hidden/keymgr.cb");
const std::string kManifest = t::InRoot("/quorvan/hidden/keymgr.list");
const std::string kLog = t::InRoot("/quorvan/spool/log/keymgr.log");

template <typename F>
std::string Output(F call) {
  testing::internal::CaptureStdout();
  call();
  std::fflush(stdout);
  return testing::internal::GetCapturedStdout();
}

std::string Data(const std::string& name) {
  return t::InRoot("/d/" + name);
}

std::string Sha(const std::string& text) {
  unsigned char digest[SHA256_DIGEST_LENGTH];
  SHA256(reinterpret_cast<const unsigned char*>(text.data()), text.size(), digest);
  return std::string(reinterpret_cast<char*>(digest), sizeof(digest));
}

class ManifestTest : public ::testing::Test {
 protected:
  void SetUp() override {
    t::ResetSandbox();
    t::MakeEeprom(0x42, 0);
    for (const char* name : {"a", "b", "c"}) {
      t::WriteFile(Data(name), name);
    }
  }
};

TEST_F(ManifestTest, HashManifestWritesOneRecordPerEntryUntilTheFirstFailure) {
  const std::string abc = Sha("a") + Sha("b") + Sha("c");
  struct Case {
    std::string manifest;
    std::string out;
    std::string digests;
  };
  for (const Case& c : std::vector<Case>{
           {Data("a") + " \t" + Data("b") + "\n\n\t" + Data("c"), "", abc},
           {Data("a") + "\n" + Data("a") + "\n", "", Sha("a") + Sha("a")},
           {"\n \t", "", ""},
           {Data("a") + " " + Data("b") + " " + Data("gone") + " " + Data("c"),
            "file[" + Data("gone") + "] status error!!\n", Sha("a") + Sha("b")},
           {Data("a") + " " + t::InRoot("/d") + " " + Data("c"),
            "file[" + t::InRoot("/d") + "] open error!!\n", Sha("a")},
           {Data("a") + " /" + std::string(99, 'y') + " " + Data("c"),
            "file[/" + std::string(39, 'y') + "...] name too long!!\n", Sha("a")},
       }) {
    t::WriteFile(kManifest, c.manifest);
    int result = 9;
    EXPECT_EQ(Output([&] { result = HashManifest(); }), c.out) << c.manifest;
    EXPECT_EQ(result, 0);
    EXPECT_EQ(t::ReadFile(kDigests), c.digests) << c.manifest;
  }
  // An entry of exactly 99 characters still fits the path buffer.
  const std::string longest = t::InRoot("/") + std::string(99 - t::Root().size() - 1, 'z');
  t::WriteFile(longest, "z");
  t::WriteFile(kManifest, longest);
  EXPECT_EQ(Output([] { HashManifest(); }), "");
  EXPECT_EQ(t::ReadFile(kDigests), Sha("z"));

  fs::remove(kManifest);
  EXPECT_EQ(Output([] { EXPECT_EQ(HashManifest(), 1); }), kManifest + " open error!!!\n");
  EXPECT_EQ(t::ReadFile(kDigests), "");
  fs::remove_all(t::InRoot("/quorvan/hidden"));
  EXPECT_EQ(Output([] { EXPECT_EQ(HashManifest(), 1); }), kDigests + " open error!!!\n");
}

TEST_F(ManifestTest, VerifyManifestFileChecksTheFirstMatchingEntryOnly) {
  t::WriteFile(kManifest, Data("a") + " " + Data("b") + " " + Data("b") + "\n" + Data("c"));
  // The second record of b is wrong, and c has none.
  t::WriteFile(kDigests, Sha("a") + Sha("b") + Sha("x"));
  auto block = [](const std::string& entry, const std::string& md, const std::string& rd) {
    return "md_sha: " + t::Hex(md) + "\nrd_sha: " + t::Hex(rd) + "\n[" + entry +
           (md == rd ? "] has integrity!!\n\n" : "] is corrupted!!\n\n");
  };
  struct Case {
    const char* path;
    std::string out;
  };
  const std::string b = Data("b");
  const std::string c = Data("c");
  const std::string relative = "d/b";
  for (const Case& k : std::vector<Case>{{nullptr, ""},
                                         {b.c_str(), block(b, Sha("b"), Sha("b"))},
                                         {c.c_str(), block(c, Sha("c"), std::string(32, '\0'))},
                                         {relative.c_str(), ""},
                                         {"/not/listed", ""}}) {
    EXPECT_EQ(Output([&] { VerifyManifestFile(k.path); }), k.out) << (k.path ? k.path : "null");
  }
  t::WriteFile(Data("b"), "changed");
  EXPECT_EQ(Output([&] { VerifyManifestFile(b.c_str()); }), block(b, Sha("changed"), Sha("b")));
  fs::remove(Data("b"));
  EXPECT_EQ(Output([&] { VerifyManifestFile(b.c_str()); }), "file[" + b + "] status error!!\n");
  t::WriteFile(kManifest, std::string(120, 'q') + " " + c);
  EXPECT_EQ(Output([&] { VerifyManifestFile(c.c_str()); }),
            "file[" + std::string(40, 'q') + "...] name too long!!\n");
  fs::remove(kManifest);
  EXPECT_EQ(Output([&] { VerifyManifestFile(c.c_str()); }), kManifest + " open error!!!\n");
  fs::remove(kDigests);
  EXPECT_EQ(Output([&] { VerifyManifestFile(c.c_str()); }), kDigests + " open error!!!\n");
  EXPECT_FALSE(t::Exists(kLog));
}

TEST_F(ManifestTest, GarbageManifestFailsTheBootRunWithoutOverrun) {
  std::string garbage;
  for (int i = 0; i < 4096; ++i) {
    garbage += static_cast<char>((i * 37 + i / 7) & 0xFF);
  }
  garbage += std::string(300, '\0') + std::string(500, '\xFF');
  t::WriteFile(kManifest, garbage);
  t::WriteFile(kDigests, garbage);
  int result = 9;
  std::string out = Output([&] { result = VerifyManifest(1); });
  EXPECT_EQ(result, 0);
  EXPECT_TRUE(out.ends_with("BN=FAIL\n")) << out;
  EXPECT_EQ(t::ReadFile(kLog), "BN=FAIL\n");
  EXPECT_EQ(Output([&] { result = HashManifest(); }).substr(0, 5), "file[");
  EXPECT_EQ(result, 0);
}

}  // namespace
