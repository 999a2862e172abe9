#include "http/chunked.h"

#include <gtest/gtest.h>

namespace velmor::http {
namespace {

const char* name(ChunkResult r) {
  switch (r) {
    case ChunkResult::need_more: return "need_more";
    case ChunkResult::done: return "done";
    case ChunkResult::too_big: return "too_big";
    case ChunkResult::bad: return "bad";
  }
  return "?";
}

const std::string kWiki = "4\r\nWiki\r\n5\r\npedia\r\nE\r\n in\r\n\r\nchunks.\r\n0\r\n\r\n";

TEST(ChunkedDecoder, WholeBodiesGoodAndBad) {
  struct Case {
    std::string text;
    ChunkResult result;
    std::string body;  // decoded, when done
    std::size_t used;  // when done or need_more
  } cases[] = {
      {kWiki, ChunkResult::done, "Wikipedia in\r\n\r\nchunks.", kWiki.size()},
      {"5;name=value\r\nhello\r\n0\r\n\r\n", ChunkResult::done, "hello", 26},
      {"5 ;ext\r\nhello\r\n0\r\n\r\n", ChunkResult::done, "hello", 20},
      {"0005\r\nhello\r\n000\r\n\r\n", ChunkResult::done, "hello", 20},
      {"A\r\n0123456789\r\n0\r\n\r\n", ChunkResult::done, "0123456789", 20},
      // Trailers, and the next message right behind the body.
      {"3\r\nabc\r\n0\r\nExpires: x\r\nX-Sum: 1\r\n\r\nGET / HTTP/1.1", ChunkResult::done, "abc", 35},
      {"5\r\nhel", ChunkResult::need_more, "", 6},
      {"5\r\nhello\r", ChunkResult::need_more, "", 8},
      {"5\r\nhello\r\n0\r", ChunkResult::need_more, "", 10},
      // Sizes that other parsers read differently.
      {"0x5\r\nhello\r\n0\r\n\r\n", ChunkResult::bad, "", 0},
      {"+5\r\nhello\r\n0\r\n\r\n", ChunkResult::bad, "", 0},
      {" 5\r\nhello\r\n0\r\n\r\n", ChunkResult::bad, "", 0},
      {"-1\r\n", ChunkResult::bad, "", 0},
      {"\r\nhello\r\n0\r\n\r\n", ChunkResult::bad, "", 0},
      {"5 x\r\nhello\r\n0\r\n\r\n", ChunkResult::bad, "", 0},
      {"g\r\n", ChunkResult::bad, "", 0},
      {"5;a\x01\r\nhello\r\n0\r\n\r\n", ChunkResult::bad, "", 0},
      {"1000000000000000\r\n", ChunkResult::too_big, "", 0},  // 2^60
      {"0fffffffffffffff\r\n", ChunkResult::need_more, "", 18},
      // Data longer than its size, and line ends without CR.
      {"5\r\nhelloX\r\n0\r\n\r\n", ChunkResult::bad, "", 0},
      {"5\r\nhelloX", ChunkResult::bad, "", 0},  // known at the first byte too many
      {"5\nhello\r\n0\r\n\r\n", ChunkResult::bad, "", 0},
      {"5\r\nhello\n0\r\n\r\n", ChunkResult::bad, "", 0},
      {"5\rhello\r\n0\r\n\r\n", ChunkResult::bad, "", 0},
      {"0\r\n\n", ChunkResult::bad, "", 0},
      // Trailers that fold or are no fields.
      {"0\r\nA: b\r\n c\r\n\r\n", ChunkResult::bad, "", 0},
      {"0\r\nno colon\r\n\r\n", ChunkResult::bad, "", 0},
  };
  for (const Case& c : cases) {
    ChunkedDecoder d;
    std::string body;
    ChunkStep step = d.feed(c.text, &body);
    EXPECT_STREQ(name(step.result), name(c.result)) << c.text;
    if (step.result == ChunkResult::done) EXPECT_EQ(body, c.body) << c.text;
    if (step.result == ChunkResult::done || step.result == ChunkResult::need_more)
      EXPECT_EQ(step.used, c.used) << c.text;
    if (step.result == ChunkResult::bad) EXPECT_FALSE(d.error().empty());
  }
}

// Feeds the text a byte more at a time, dropping what each call used.
ChunkResult trickle(ChunkedDecoder& d, std::string_view text, std::string* body, std::size_t& used) {
  std::string pending;
  used = 0;
  for (char c : text) {
    pending += c;
    ChunkStep step = d.feed(pending, body);
    pending.erase(0, step.used);
    used += step.used;
    if (step.result != ChunkResult::need_more) return step.result;
  }
  return ChunkResult::need_more;
}

TEST(ChunkedDecoder, ResumesAtAnyByteWithTheSameResult) {
  ChunkedDecoder d;
  std::string body;
  std::size_t used = 0;
  const std::string text = "1a;x=\"y\"\r\nabcdefghijklmnopqrstuvwxyz\r\n" + kWiki.substr(0, kWiki.size() - 2) +
                           "Trailer-One: 1\r\n\r\nnext";
  ASSERT_EQ(trickle(d, text, &body, used), ChunkResult::done);
  EXPECT_EQ(body, "abcdefghijklmnopqrstuvwxyzWikipedia in\r\n\r\nchunks.");
  EXPECT_EQ(used, text.size() - 4);
  EXPECT_EQ(d.body_size(), body.size());
  EXPECT_EQ(d.trailers().get("trailer-one"), "1");
  EXPECT_EQ(d.feed("more").result, ChunkResult::done);  // a finished body takes nothing more

  ChunkedDecoder relay;  // no body wanted: only its end
  EXPECT_EQ(trickle(relay, kWiki, nullptr, used), ChunkResult::done);
  EXPECT_EQ(used, kWiki.size());
}

TEST(ChunkedDecoder, Limits) {
  const ChunkLimits limits{.max_line = 16, .max_trailer_bytes = 20, .max_trailer_fields = 2, .max_body = 10};
  struct Case {
    std::string text;
    ChunkResult result;
  } cases[] = {
      {"5;" + std::string(14, 'e') + "\r\n", ChunkResult::need_more},  // a 16-byte line
      {"5;" + std::string(15, 'e') + "\r\n", ChunkResult::too_big},
      {"5;" + std::string(20, 'e'), ChunkResult::too_big},  // no line end needed to know
      {"5\r\nhello\r\n5\r\nworld\r\n0\r\n\r\n", ChunkResult::done},
      {"5\r\nhello\r\n6\r\n", ChunkResult::too_big},
      {"0\r\nA: 1\r\nB: 2\r\n\r\n", ChunkResult::done},
      {"0\r\nA: 1\r\nB: 2\r\nC: 3\r\n\r\n", ChunkResult::too_big},
      {"0\r\nA: " + std::string(20, 'x'), ChunkResult::too_big},
  };
  for (const Case& c : cases) {
    ChunkedDecoder d(limits);
    EXPECT_STREQ(name(d.feed(c.text).result), name(c.result)) << c.text;
  }
}

TEST(ChunkedEncoder, PiecesDecodeBackWithTrailers) {
  EXPECT_EQ(chunk(""), "");
  EXPECT_EQ(chunk("hello"), "5\r\nhello\r\n");
  EXPECT_EQ(chunk_size_line(255), "ff\r\n");
  HeaderList trailers;
  trailers.add("X-Sum", "7");
  const std::string text = chunk("abc") + chunk(std::string(300, 'z')) + last_chunk(trailers);
  EXPECT_TRUE(text.ends_with("0\r\nX-Sum: 7\r\n\r\n"));
  ChunkedDecoder d;
  std::string body;
  EXPECT_EQ(d.feed(text, &body).result, ChunkResult::done);
  EXPECT_EQ(body, "abc" + std::string(300, 'z'));
  EXPECT_EQ(d.trailers(), trailers);
}

}  // namespace
}  // namespace velmor::http
