#include <string>

#include <gtest/gtest.h>

#include "core/util.h"

namespace velmor {
namespace {

TEST(Md5, KnownAnswersOfTheReferenceSuite) {
  const std::pair<const char*, const char*> suite[] = {
      {"", "d41d8cd98f00b204e9800998ecf8427e"},
      {"a", "0cc175b9c0f1b6a831c399e269772661"},
      {"abc", "900150983cd24fb0d6963f7d28e17f72"},
      {"message digest", "f96b697d7cb7938d525a2f31aaf161d0"},
      {"abcdefghijklmnopqrstuvwxyz", "c3fcd3d76192e4007dfb496cca67e13b"},
      {"ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789", "d174ab98d277d9f5a5611c2c9f419d9f"},
      {"12345678901234567890123456789012345678901234567890123456789012345678901234567890",
       "57edf4a22be3c955ac49da2e2107b67a"},
  };
  for (const auto& [text, digest] : suite) EXPECT_EQ(md5_hex(text), digest) << text;

  // Fed in pieces that straddle the 64-byte blocks, the digest is the same.
  std::string long_text;
  for (int i = 0; i < 1000; ++i) long_text += static_cast<char>(i * 31);
  Md5 ctx;
  md5_init(ctx);
  for (std::size_t i = 0; i < long_text.size(); i += 37) {
    md5_update(ctx, std::string_view(long_text).substr(i, 37));
    md5_update(ctx, std::string_view());  // empty, with no data pointer, in mid-block
  }
  unsigned char d[16];
  md5_final(ctx, d);
  std::string hex;
  for (unsigned char c : d) hex += "0123456789abcdef"[c >> 4], hex += "0123456789abcdef"[c & 15];
  EXPECT_EQ(hex, md5_hex(long_text));
}

TEST(Md5Crypt, MatchesHashesMadeByOpenssl) {
  // openssl passwd -1 -salt SALT PASSWORD
  const std::tuple<const char*, const char*, const char*> cases[] = {
      {"password", "saltsalt", "$1$saltsalt$qjXMvbEw8oaL.CzflDtaK/"},
      {"secret", "ab", "$1$ab$dslkcXxVH.x8LwW1W/oAB/"},
      {"", "x", "$1$x$fwjfZtMwarkdetsjiQreU1"},
      {"a very long password that exceeds sixteen bytes by far", "12345678", "$1$12345678$b3T5ifAqI.CwIN7WYkHvV."},
      {"p\xc3\xa4ssw\xc3\xb6rd", "Zz.9/", "$1$Zz.9/$Zqi2cdBH0/.WR3vLRIGE81"},
      {"hello", "salt", "$1$salt$BSpYmSAZQYBttsZ28Ph1f/"},
  };
  for (const auto& [password, salt, hash] : cases) {
    EXPECT_EQ(md5_crypt(password, salt), hash) << password;
    // Checking a password: the stored hash is the setting.
    EXPECT_EQ(md5_crypt(password, hash), hash);
    EXPECT_NE(md5_crypt(std::string(password) + "x", hash), hash);
  }
  // The salt stops at "$" and after eight characters.
  EXPECT_EQ(md5_crypt("test", "$1$123456789abc"), "$1$12345678$oEitTZYQtRHfNGmsFvTBA/");
  EXPECT_EQ(md5_crypt("hello", "salt$rest"), "$1$salt$BSpYmSAZQYBttsZ28Ph1f/");

  EXPECT_TRUE(constant_time_equals("abc", "abc"));
  EXPECT_FALSE(constant_time_equals("abc", "abd"));
  EXPECT_FALSE(constant_time_equals("abc", "abcd"));
  EXPECT_TRUE(constant_time_equals("", ""));
}

TEST(Base64, VectorsAndRoundTrips) {
  const std::pair<const char*, const char*> vectors[] = {
      {"", ""},         {"f", "Zg=="},         {"fo", "Zm8="},        {"foo", "Zm9v"},
      {"foob", "Zm9vYg=="}, {"fooba", "Zm9vYmE="}, {"foobar", "Zm9vYmFy"},
  };
  for (const auto& [plain, coded] : vectors) {
    EXPECT_EQ(base64_encode(plain), coded);
    EXPECT_EQ(base64_decode(coded), plain);
  }
  EXPECT_EQ(base64_encode("abc"), "YWJj");
  EXPECT_EQ(base64_encode("ab"), "YWI=");
  // Leading blanks are skipped; the data ends at the first foreign character.
  EXPECT_EQ(base64_decode(" \tZm9vYmFy\r\nZm9v"), "foobar");
  EXPECT_EQ(base64_decode("dXNlcgBwYXNz"), std::string("user\0pass", 9));

  std::string all;
  for (int i = 0; i < 256; ++i) all += static_cast<char>(i);
  for (std::size_t n : {0u, 1u, 2u, 3u, 100u, 256u}) EXPECT_EQ(base64_decode(base64_encode(all.substr(0, n))), all.substr(0, n));
}

TEST(Uuencode, SixBitsPlusThirtyTwo) {
  EXPECT_EQ(uu_encode("Cat"), "0V%T");
  EXPECT_EQ(uu_encode(std::string(3, '\0')), "    ");
  EXPECT_EQ(uu_encode("C").size(), 4u);  // a short last group still gives four characters
}

}  // namespace
}  // namespace velmor
