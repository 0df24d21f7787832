// The long SipHash against digests that another implementation made (`openssl mac ... SIPHASH`).

#include "platform/SipHash.h"

#include <gtest/gtest.h>

#include <numeric>

namespace tessel {
namespace {

TEST(SipHashTest, DigestsAreThoseOfOthers) {
  SipKey key;
  std::iota(key.begin(), key.end(), uint8_t{0});
  const SipHash128 ofNothing{0xa3, 0x81, 0x7f, 0x04, 0xba, 0x25, 0xa8, 0xe6,
                             0x6d, 0xf6, 0x72, 0x14, 0xc7, 0x55, 0x02, 0x93};
  const SipHash128 ofText{0xc6, 0x30, 0xb9, 0xfb, 0xf2, 0x68, 0x62, 0x5c,
                          0x85, 0x48, 0xea, 0x0c, 0x8c, 0xda, 0x75, 0x9a};
  EXPECT_EQ(sipHash128("", key), ofNothing);
  EXPECT_EQ(sipHash128("The reader keeps the token", key), ofText);
}

}  // namespace
}  // namespace tessel
