#include "mail/mime_text.h"

#include <gtest/gtest.h>

#include <string>

namespace velmor {
namespace {

TEST(MimeText, FoldingMakesCapitalsSmallInLatinGreekAndCyrillicOnly) {
  const struct {
    std::string_view in, out;
  } kCases[] = {
      {"Hello WORLD 123", "hello world 123"},
      {"ÀÉÎÕÜ Þ × ß ÿ", "àéîõü þ × ß ÿ"},            // Latin-1; × and ß stay
      {"ĀĂĆČĎ ĹĽŁŃŇ Ŋ ŹŻŽ Ÿ İ ı", "āăćčď ĺľłńň ŋ źżž ÿ i ı"},  // Latin Extended-A, in its three runs
      {"ΑΒΓ ΣΩ", "αβγ σω"},
      {"ПРИВЕТ Мир ЁЖИК Ђ Ѡ Ґ Ӂ Ӑ", "привет мир ёжик ђ ѡ ґ ӂ ӑ"},
      {"日本 €", "日本 €"},                             // three-byte characters pass
      {"A\xC3", "a\xC3"},                              // a cut sequence passes as it is
      {"\xC3\x28 \xFF", "\xC3\x28 \xFF"},              // so do bytes that are not UTF-8
  };
  for (const auto& c : kCases) {
    EXPECT_EQ(utf8_fold(c.in), c.out) << c.in;
    EXPECT_EQ(utf8_fold(utf8_fold(c.in)), c.out) << c.in;
  }
}

TEST(MimeText, EncodedWordsDecodeToUtf8) {
  const struct {
    std::string_view in, out;
  } kCases[] = {
      {"=?UTF-8?B?0J/RgNC40LLQtdGC?=", "Привет"},
      {"=?utf-8?q?caf=C3=A9_au_lait?=", "café au lait"},
      {"=?ISO-8859-1?Q?Gr=FC=DFe?= aus Berlin", "Grüße aus Berlin"},
      {"=?KOI8-R?B?8NLJ18XU?=", "Привет"},
      {"=?windows-1251?Q?=CC=E8=F0?=", "Мир"},
      // The blanks between two encoded words go; a character split between
      // them comes out whole.
      {"=?UTF-8?B?0J/R?= \r\n =?UTF-8?B?gNC40LLQtdGC?=", "Привет"},
      {"Re: =?UTF-8?B?0JzQuNGA?= again", "Re: Мир again"},
      {"=?UTF-8*ru?B?0JzQuNGA?=", "Мир"},  // a language after the charset
      // Not encoded words: kept as they are.
      {"=?UTF-8?X?abc?=", "=?UTF-8?X?abc?="},
      {"=?UTF-8?B?abc", "=?UTF-8?B?abc"},
      {"=?UTF-8?Q?a b?=", "=?UTF-8?Q?a b?="},
      {"plain =? text", "plain =? text"},
      // Unknown or oddly named charsets pass the bytes; what does not
      // convert becomes U+FFFD.
      {"=?x-no-such?Q?abc?=", "abc"},
      {"=?../../etc?Q?abc?=", "abc"},
      {"=?US-ASCII?Q?=FF?=", "\xFF"},
      {"=?ISO-2022-JP?B?GyRCJCIbKEI=?=", "あ"},
      {"=?EUC-JP?Q?=A4?=", "\xEF\xBF\xBD"},
  };
  for (const auto& c : kCases) EXPECT_EQ(header_words_decode(c.in), c.out) << c.in;
}

TEST(MimeText, TransferDecodingInPiecesOfAnySize) {
  const struct {
    TransferDecoder::Kind kind;
    std::string_view in, out;
  } kCases[] = {
      {TransferDecoder::Kind::base64, "0J/RgNC4\r\n0LLQtdGC\r\n", "Привет"},
      {TransferDecoder::Kind::base64, "aGk=\r\nIHRoZXJl\r\n", "hi there"},  // padding, then another block
      {TransferDecoder::Kind::quoted_printable, "caf=C3=A9 soft=\r\nbreak=\nand =3D =ZZ end=", "café softbreakand = =ZZ end="},
      {TransferDecoder::Kind::identity, "as =41 is", "as =41 is"},
  };
  for (const auto& c : kCases) {
    for (std::size_t piece : {1, 2, 3, 1000}) {
      TransferDecoder d(c.kind);
      std::string out;
      for (std::size_t at = 0; at < c.in.size(); at += piece) d.feed(c.in.substr(at, piece), out);
      d.finish(out);
      EXPECT_EQ(out, c.out) << c.in << " in pieces of " << piece;
    }
  }
  EXPECT_EQ(transfer_kind(" Base64 "), TransferDecoder::Kind::base64);
  EXPECT_EQ(transfer_kind("QUOTED-PRINTABLE"), TransferDecoder::Kind::quoted_printable);
  EXPECT_EQ(transfer_kind("8bit"), TransferDecoder::Kind::identity);
}

}  // namespace
}  // namespace velmor
