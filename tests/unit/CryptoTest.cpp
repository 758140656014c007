// HMAC-SHA256 through the platform facade, the way message signing uses it:
// the test cases of RFC 4231 (all 32 bytes of each MAC, keys shorter than,
// and longer than, the 64-byte block), fed whole and in pieces that split
// the message anywhere, with the context cleared by Final.
#include "MockSmbServer.h"
#include "NwPlatform.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <string>

namespace {

using MockSmb::Hex;

const uint8_t *BytesOf(const std::string &Text) {
  return reinterpret_cast<const uint8_t *>(Text.data());
}

// The MAC of Data under Key, fed in updates of at most Piece bytes; empty
// when a call fails or Final leaves anything in the context.
std::string MacInPieces(const std::string &Key, const std::string &Data, size_t Piece) {
  NwHmacSha256Context Ctx;
  if (!NwHmacSha256Init(&Ctx, BytesOf(Key), Key.size())) {
    return "";
  }
  for (size_t Done = 0; Done < Data.size(); Done += Piece) {
    if (!NwHmacSha256Update(&Ctx, Data.data() + Done, std::min(Piece, Data.size() - Done))) {
      return "";
    }
  }
  uint8_t Mac[NW_SHA256_DIGEST_SIZE];
  if (!NwHmacSha256Final(&Ctx, Mac)) {
    return "";
  }
  for (uint8_t Byte : Ctx.Opaque) {
    if (Byte != 0) {
      return "";
    }
  }
  return Hex(Mac, sizeof(Mac));
}

TEST(Crypto, HmacSha256MatchesRfc4231InAnyPieces) {
  std::string Counting;
  for (char Byte = 1; Byte <= 25; Byte++) {
    Counting += Byte;
  }
  const struct {
    std::string Key;
    std::string Data;
    const char *Mac;
  } kCases[] = {
      {std::string(20, '\x0b'), "Hi There",
       "b0344c61d8db38535ca8afceaf0bf12b881dc200c9833da726e9376c2e32cff7"},
      {std::string(131, '\xaa'), "Test Using Larger Than Block-Size Key - Hash Key First",
       "60e431591ee0b67f0d8a26aacbf5b77f8e0bc6213728c5140546040f0ee37f54"},
      {std::string(131, '\xaa'),
       "This is a test using a larger than block-size key and a larger than block-size data. "
       "The key needs to be hashed before being used by the HMAC algorithm.",
       "9b09ffa71b942fcb27635fbcd5b0e944bfdc63644f0713938a7f51535c3a35e2"},
  };
  int Case = 1;
  for (const auto &C : kCases) {
    for (size_t Piece : {C.Data.size() + 1, size_t{1}, size_t{7}, size_t{63}, size_t{64}}) {
      EXPECT_EQ(MacInPieces(C.Key, C.Data, Piece), C.Mac)
          << "case " << Case << ", pieces of " << Piece;
    }
    Case++;
  }

  NwHmacSha256Context Ctx;
  uint8_t Mac[NW_SHA256_DIGEST_SIZE];
  EXPECT_FALSE(NwHmacSha256Init(nullptr, Mac, 1));
  EXPECT_FALSE(NwHmacSha256Init(&Ctx, nullptr, 1));
  ASSERT_TRUE(NwHmacSha256Init(&Ctx, nullptr, 0));
  EXPECT_FALSE(NwHmacSha256Update(&Ctx, nullptr, 1));
  EXPECT_FALSE(NwHmacSha256Final(&Ctx, nullptr));
  EXPECT_TRUE(NwHmacSha256Final(&Ctx, Mac));
}

} // namespace
