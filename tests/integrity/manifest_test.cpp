#include "integrity/manifest.h"

#include <openssl/sha.h>

#include <gtest/gtest.h>

#include <cstdio>
#include <filesystem>
#include <string>

#include "support/sandbox.h"

namespace {

namespace t = keymgr::test;
namespace fs = std::filesystem;

const std::string kDigests = t::InRoot("/quorvan/hidden/keymgr.cb");
const std::string kManifest = t::InRoot("/quorvan/hidden/keymgr.list");
const std::string a = t::InRoot("/d/a"), b = t::InRoot("/d/b"), c = t::InRoot("/d/c");

template <typename F>
std::string Output(F call) {
  testing::internal::CaptureStdout();
  call();
  std::fflush(stdout);
  return testing::internal::GetCapturedStdout();
}

std::string Sha(const std::string& text) {
  std::string digest(32, '\0');
  SHA256(reinterpret_cast<const unsigned char*>(text.data()), text.size(),
         reinterpret_cast<unsigned char*>(digest.data()));
  return digest;
}

void Prepare(const std::string& manifest) {
  t::ResetSandbox();
  t::MakeEeprom(0x42, 0);
  t::WriteFile(a, "a"), t::WriteFile(b, "b"), t::WriteFile(c, "c");
  t::WriteFile(kManifest, manifest);
}

TEST(ManifestTest, HashManifestWritesOneRecordPerEntryUntilTheFirstFailure) {
  const std::string gone = t::InRoot("/d/gone"), dir = t::InRoot("/d");
  // The longest entry that fits the 100-byte buffer: 99 characters.
  const std::string longest = t::InRoot("/") + std::string(98 - t::Root().size(), 'z');
  struct Case {
    std::string manifest, out, digests;
  } cases[] = {
      {a + " \t" + b + "\n\n\t" + c + " " + a, "", Sha("a") + Sha("b") + Sha("c") + Sha("a")},
      {"\n \t", "", ""},
      {a + " " + gone + " " + c, "file[" + gone + "] status error!!\n", Sha("a")},
      {dir + " " + c, "file[" + dir + "] open error!!\n", ""},
      {longest + " " + longest + "z " + c,
       "file[" + longest.substr(0, 40) + "...] name too long!!\n", Sha("z")},
  };
  for (const Case& k : cases) {
    Prepare(k.manifest);
    t::WriteFile(longest, "z");
    EXPECT_EQ(Output([] { EXPECT_EQ(HashManifest(), 0); }), k.out);
    EXPECT_EQ(t::ReadFile(kDigests), k.digests) << k.manifest;
  }
  fs::remove(kManifest);
  EXPECT_EQ(Output([] { EXPECT_EQ(HashManifest(), 1); }), kManifest + " open error!!!\n");
  EXPECT_EQ(t::ReadFile(kDigests), "");
  fs::remove_all(t::InRoot("/quorvan/hidden"));
  EXPECT_EQ(Output([] { EXPECT_EQ(HashManifest(), 1); }), kDigests + " open error!!!\n");
}

TEST(ManifestTest, VerifyManifestFileChecksTheFirstMatchingEntryOnly) {
  Prepare(a + " " + b + " " + b + "\n" + c + " " + std::string(120, 'q'));
  t::WriteFile(kDigests, Sha("a") + Sha("b") + Sha("x"));  // c has no record
  auto block = [](const std::string& entry, const std::string& md, const std::string& rd) {
    return "md_sha: " + t::Hex(md) + "\nrd_sha: " + t::Hex(rd) + "\n[" + entry +
           (md == rd ? "] has integrity!!\n\n" : "] is corrupted!!\n\n");
  };
  EXPECT_EQ(Output([] { VerifyManifestFile(b.c_str()); }), block(b, Sha("b"), Sha("b")));
  EXPECT_EQ(Output([] { VerifyManifestFile(c.c_str()); }), block(c, Sha("c"), std::string(32, 0)));
  EXPECT_EQ(Output([] { VerifyManifestFile("/x"); }),
            "file[" + std::string(40, 'q') + "...] name too long!!\n");
  EXPECT_EQ(Output([] { VerifyManifestFile(nullptr); }), "");
  t::WriteFile(b, "changed");
  EXPECT_EQ(Output([] { VerifyManifestFile(b.c_str()); }), block(b, Sha("changed"), Sha("b")));
  fs::remove(b);
  EXPECT_EQ(Output([] { VerifyManifestFile(b.c_str()); }), "file[" + b + "] status error!!\n");
  fs::remove(kDigests);
  EXPECT_EQ(Output([] { VerifyManifestFile(b.c_str()); }), kDigests + " open error!!!\n");
}

TEST(ManifestTest, GarbageManifestFailsTheBootRunWithoutOverrun) {
  std::string garbage(300, '\0');
  for (int i = 0; i < 4096; ++i) {
    garbage += static_cast<char>((i * 37 + i / 7) & 0xFF);
  }
  Prepare(garbage + std::string(500, '\xFF'));
  t::WriteFile(kDigests, garbage);
  EXPECT_TRUE(Output([] { EXPECT_EQ(VerifyManifest(1), 0); }).ends_with("BN=FAIL\n"));
  EXPECT_TRUE(Output([] { EXPECT_EQ(HashManifest(), 0); }).starts_with("file["));
}

}  // namespace
