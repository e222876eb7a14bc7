// The sealed fragment's encoder, and its decoder on what it encoded. What
// the decoder refuses of damaged or hostile bytes is the fragment fuzzer's.
#include "platform/fragment.h"

#include <gtest/gtest.h>

#include <vector>

namespace {

using Bytes = std::vector<uint8_t>;

TEST(Fragment, EncodesWithinItsSizeAndDecodesWhatItEncoded) {
  Bytes cipher(256), fragment(PCP_FRAGMENT_SIZE);
  for (size_t i = 0; i < cipher.size(); ++i) {
    cipher[i] = static_cast<uint8_t>(i * 7 + 1);
  }
  const auto out = std::span<uint8_t, PCP_FRAGMENT_SIZE>(fragment.data(), PCP_FRAGMENT_SIZE);
  EXPECT_FALSE(keymgr::tpm::EncodeFragment({}, out).ok());
  EXPECT_FALSE(keymgr::tpm::EncodeFragment(Bytes(257), out).ok());
  ASSERT_TRUE(keymgr::tpm::EncodeFragment({cipher.data(), 128}, out).ok());
  EXPECT_EQ(Bytes(fragment.begin(), fragment.begin() + 12),
            (Bytes{'P', 'C', 'P', 'F', 0, 0, 0, 1, 0, 0, 0, 128}));
  EXPECT_EQ(Bytes(fragment.begin() + 140, fragment.end()), Bytes(128, 0));
  ASSERT_TRUE(keymgr::tpm::EncodeFragment(cipher, out).ok());
  std::span<const uint8_t> inside;
  ASSERT_TRUE(keymgr::tpm::DecodeFragment(fragment, &inside).ok());
  EXPECT_EQ(Bytes(inside.begin(), inside.end()), cipher);
  EXPECT_FALSE(keymgr::tpm::DecodeFragment({fragment.data(), PCP_FRAGMENT_SIZE - 1}, &inside).ok());
}

}  // namespace
