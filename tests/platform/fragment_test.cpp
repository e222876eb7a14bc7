// The sealed fragment's codec, without a TPM: what decodes, and every header
// or size a damaged or hostile keymgr.ook could hold.
#include "platform/fragment.h"

#include <gtest/gtest.h>

#include <vector>

namespace {

using keymgr::tpm::DecodeFragment;
using keymgr::tpm::EncodeFragment;
using Bytes = std::vector<uint8_t>;

TEST(Fragment, DecodesWhatWasEncodedAndRefusesDamage) {
  Bytes cipher(256), fragment(PCP_FRAGMENT_SIZE);
  for (size_t i = 0; i < cipher.size(); ++i) {
    cipher[i] = static_cast<uint8_t>(i * 7 + 1);
  }
  auto out = std::span<uint8_t, PCP_FRAGMENT_SIZE>(fragment.data(), PCP_FRAGMENT_SIZE);
  EXPECT_FALSE(EncodeFragment({}, out).ok());
  EXPECT_FALSE(EncodeFragment(Bytes(257), out).ok());
  ASSERT_TRUE(EncodeFragment({cipher.data(), 128}, out).ok());
  EXPECT_EQ(Bytes(fragment.begin(), fragment.begin() + 12),
            (Bytes{'P', 'C', 'P', 'F', 0, 0, 0, 1, 0, 0, 0, 128}));
  EXPECT_EQ(Bytes(fragment.begin() + 140, fragment.end()), Bytes(128, 0));
  ASSERT_TRUE(EncodeFragment(cipher, out).ok());

  std::span<const uint8_t> inside;
  ASSERT_TRUE(DecodeFragment(fragment, &inside).ok());
  EXPECT_EQ(Bytes(inside.begin(), inside.end()), cipher);
  const struct {
    const char* name;
    size_t at;  // byte changed, or the length given when |value| is -1
    int value;
  } damage[] = {
      {"tag", 0, 'p'},    {"version", 7, 2},       {"empty", 10, 0},
      {"over 256", 9, 1}, {"past the end", 0, -1}, {"no header", 11, -1},
  };
  for (const auto& [name, at, value] : damage) {
    Bytes bad = fragment;
    size_t length = bad.size();
    if (value < 0) {
      length = at == 0 ? PCP_FRAGMENT_SIZE - 1 : at;
    } else {
      bad[at] = static_cast<uint8_t>(value);
    }
    EXPECT_FALSE(DecodeFragment({bad.data(), length}, &inside).ok()) << name;
  }
}

}  // namespace
