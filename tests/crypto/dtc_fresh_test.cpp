// Runs alone in its process: the AES key record must not have been bound yet.
#include <gtest/gtest.h>
#include <kmm/dtc.h>

TEST(DtcFreshProcess, UnboundKeyRecordRefusesToRun) {
  ProtectedKey *key = nullptr, *param = nullptr;
  std::uint32_t keyLength = 0, paramLength = 0;
  VKT_DTC_GetConstant(DTC_CONST_AES_KEY, &key, &keyLength);
  VKT_DTC_GetConstant(DTC_CONST_AES_PARAM, &param, &paramLength);
  EXPECT_EQ(keyLength, 32u);
  CryptoContainer c = VKT_DTC_CreateCryptoContainer();
  ASSERT_NE(c, nullptr);
  EXPECT_EQ(VKT_DTC_AES_Init(c, DTC_AES_DECRYPT, DTC_AES_MODE, key, keyLength, param),
            DTC_E_KEY_NOT_BOUND);
  EXPECT_EQ(VKT_DTC_DestroyCryptoContainer(c), 0u);
}
