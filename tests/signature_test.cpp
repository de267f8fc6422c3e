#include <glib.h>
#include <gtest/gtest.h>

#include <cstdlib>
#include <string>

#include "sitedeck-service-raii.h"
#include "pull/sitedeck-service-signature.h"
#include "support/temp_root.h"

namespace {

std::string glib_md5(const std::string& text) {
  gchar* hex = g_compute_checksum_for_string(G_CHECKSUM_MD5, text.c_str(), -1);
  std::string out = hex;
  g_free(hex);
  return out;
}

std::string md5_hex(const std::string& text) {
  UniqueCStr hex(sds_md5_hex(text.c_str()));
  return hex ? hex.get() : "(null)";
}

TEST(Md5, Rfc1321TestSuite) {
  struct Case {
    const char* input;
    const char* digest;
  } cases[] = {
      {"", "d41d8cd98f00b204e9800998ecf8427e"},
      {"a", "0cc175b9c0f1b6a831c399e269772661"},
      {"abc", "900150983cd24fb0d6963f7d28e17f72"},
      {"message digest", "f96b697d7cb7938d525a2f31aaf161d0"},
      {"abcdefghijklmnopqrstuvwxyz", "c3fcd3d76192e4007dfb496cca67e13b"},
      {"ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789",
       "d174ab98d277d9f5a5611c2c9f419d9f"},
      {"12345678901234567890123456789012345678901234567890123456789012345678901234567890",
       "57edf4a22be3c955ac49da2e2107b67a"},
  };
  for (const auto& c : cases) EXPECT_EQ(md5_hex(c.input), c.digest) << '"' << c.input << '"';
  // The digest words are little-endian reads of the hex.
  uint32_t digest[4];
  sds_md5("", 0, digest);
  EXPECT_EQ(digest[0], 0xd98c1dd4u);
  EXPECT_EQ(digest[3], 0x7e42f8ecu);
}

TEST(Md5, BlockBoundariesAgreeWithGlib) {
  // 55 bytes still fit the padding into one block, 56 need a second one.
  for (size_t length : {55u, 56u, 63u, 64u, 65u, 119u, 120u, 1000u}) {
    std::string text(length, 'x');
    for (size_t i = 0; i < length; ++i) text[i] = static_cast<char>('!' + i % 90);
    EXPECT_EQ(md5_hex(text), glib_md5(text)) << length;
  }
}

// Signed queries with content are checked whole in the request URL tests.
TEST(Signature, IsMd5OfQueryFollowedByTheKey) {
  UniqueCStr hash(sds_get_request_hash(""));
  ASSERT_TRUE(hash);
  EXPECT_EQ(std::string(hash.get()), glib_md5("SITEDECKTESTKEY0123456789ABCDEFG"));
  EXPECT_EQ(sds_get_request_hash(nullptr), nullptr);
}

TEST(Signature, PlainKeyIsNotInTheLibrary) {
  // The compiler scrambles the key with ROT13 (letters move by 13, digits stay);
  // the module that ships must hold only that form.
  EXPECT_STREQ(sds_request_signing_key, "FVGRQRPXGRFGXRL0123456789NOPQRST");
  std::string plain = sds_request_signing_key;
  for (char& c : plain) {
    if (c >= 'A' && c <= 'Z') c = static_cast<char>('A' + (c - 'A' + 13) % 26);
  }
  const std::string library = read_file(SITEDECK_BIN_DIR "/libsitedeck-pull.so");
  ASSERT_FALSE(library.empty());
  EXPECT_EQ(library.find(plain), std::string::npos);
  EXPECT_NE(library.find(sds_request_signing_key), std::string::npos);
}

}  // namespace
