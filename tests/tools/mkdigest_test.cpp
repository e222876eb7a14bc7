// keymgr-mkdigest signs only what the device checks as it was hashed, and
// stays inside the image root it is given.
#include <gtest/gtest.h>

#include <filesystem>

#include "support/sandbox.h"
#include "util/paths.h"

namespace {

namespace t = keymgr::test;
namespace fs = std::filesystem;

const std::string M = KEYMGR_TEST_MKDIGEST_BIN, S = KEYMGR_TEST_SIGNED_BIN;
const std::string kKey = KEYMGR_TEST_SOURCE_DIR "/tests/cli/data/digest_key.pem";
const std::string kManifest = keymgr::kManifestPath, kDigests = keymgr::kDigestFilePath,
                  kSig = keymgr::kSignaturePath;

// The sandbox seen at "/" is the device's root: each manifest mkdigest signs
// there, the signed keymgr passes; each it refuses is named with the entry,
// and nothing is written. The release is the suite's, so that the TPM's
// release floor takes it whatever ran before.
TEST(Mkdigest, SignsOnlyWhatTheDeviceChecksAlike) {
  const std::string a = t::InRoot("/d/a"), l = t::InRoot("/d/l"), up = t::InRoot("/d/sub/up");
  const struct {
    const char* name;
    std::string manifest, refusal;  // refusal: "" when signed
  } rows[] = {
      // clang-format off
      {"white space of every kind, a link", " " + a + "\t\n" + l + "\v" + a + "\r\n", ""},
      {"a link whose target climbs", up, ""},
      {"an empty manifest", "", "no entries"},
      {"white space alone", " \n\t", "no entries"},
      {"a trailing slash", a + " " + a + "/", a + "/: ends with a slash"},
      {"a relative entry", a.substr(1), a.substr(1) + ": a relative entry"},
      {"a . component", t::InRoot("/d/./a"), "/d/./a: not in normal form"},
      {"a .. component", t::InRoot("/d/sub/../a"), "/d/sub/../a: not in normal form"},
      {"a doubled slash", t::InRoot("/d//a"), "/d//a: not in normal form"},
      {"a missing file", t::InRoot("/d/gone"), "/d/gone: cannot be hashed"},
      {"a folder", t::InRoot("/d/sub"), "/d/sub: cannot be hashed"},
      // clang-format on
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    t::ResetDevice(0x42, 0);
    t::WriteFile(a, "a");
    fs::create_symlink(a, l);
    fs::create_directories(t::InRoot("/d/sub"));
    fs::create_symlink("../a", up);
    t::WriteFile(kManifest, row.manifest);
    t::WriteFile(kDigests, "OLD");
    const auto made = t::Run({M, "--root", "/", "--manifest", kManifest, "--output", kDigests,
                              "--key", kKey, "--counter", "42"});
    EXPECT_EQ(made.status, row.refusal.empty() ? 0 : 1) << made.err;
    if (row.refusal.empty()) {
      const auto run = t::Run({S});
      EXPECT_EQ(std::to_string(run.status) + run.out, "0SFE_003 - [0]\nBN=OK\n");
    } else {
      EXPECT_NE(made.err.find(row.refusal), std::string::npos) << made.err;
      EXPECT_EQ(t::ReadFile(kDigests), "OLD");
      EXPECT_FALSE(fs::exists(kSig));
    }
  }
}

// In an image whose hidden folder is an absolute link naming a folder of the
// build host, the manifest is read and both files written in the image's
// folder of that name; absolute links and ".." in the image stay in it. The
// same tree and key give the same keymgr.sig on every host: the one below
// was made on x86-64, and the aarch64 suite makes it under qemu-user. A path
// given outside the root, and a signature without a release from 1, are
// refused and write nothing.
TEST(Mkdigest, StaysInsideTheImageRoot) {
  t::ResetDevice(0x42, 0);
  const std::string root = t::InRoot("/image"), host = t::InRoot("/host");
  t::WriteFile(host + "/keymgr.list", "/etc/host\n");
  t::WriteFile(root + host + "/keymgr.list", "/etc/l /etc/up /etc/x\n");
  t::WriteFile(root + "/etc/x", "x");
  fs::create_symlink("/etc/x", root + "/etc/l");
  fs::create_symlink("../../../etc/x", root + "/etc/up");
  fs::create_directories(root + "/quorvan");
  fs::create_symlink(host, root + "/quorvan/hidden");
  ASSERT_EQ(t::Run({M, "--root", root + "/", "--key", kKey, "--counter", "7"}).status, 0);
  const std::string x = t::Sha256("x");
  EXPECT_EQ(t::ReadFile(root + host + "/keymgr.cb"), x + x + x);
  EXPECT_EQ(t::LowerHex(*t::ReadFile(root + host + "/keymgr.sig")),
            "4b4d534700000001e85ccff33f6ba91c000000000000000780af61335ea3d18b9e5c9d"
            "529ee0e3f67426f7a80092d2a44d4645b33322bf51335fa9f48894ed578d7c6676cfd0"
            "f1510752479cbd604daea1472a0363639702bf41ae71ee4185bbfa7b91e2e1d1a037a8"
            "e3066f8a2ff55b00bef3854228cbb7011b77fe830a83a0d73572dac664286d14c2e823"
            "35eb9e1ae1ba55b80759e200");
  fs::remove(root + host + "/keymgr.sig");
  const std::vector<std::string> refused[] = {
      {"--manifest", host + "/keymgr.list"},
      {"--output", host + "/keymgr.cb"},
      {"--output", root + "/quorvan/.."},
      {"--key", kKey, "--counter", "0"},
      {"--key", kKey},
  };
  for (const auto& args : refused) {
    std::vector<std::string> argv = {M, "--root", root};
    argv.insert(argv.end(), args.begin(), args.end());
    const auto made = t::Run(argv);
    EXPECT_EQ(made.status, args[0] == "--key" ? 2 : 1) << args[1];
    EXPECT_FALSE(fs::exists(host + "/keymgr.cb") || fs::exists(root + host + "/keymgr.sig"))
        << args[1];
  }
}

}  // namespace
