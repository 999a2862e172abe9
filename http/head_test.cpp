#include <gtest/gtest.h>

#include "http/framing.h"
#include "http/head.h"
#include "http/response.h"

namespace velmor::http {
namespace {

const char* name(HeadResult r) {
  switch (r) {
    case HeadResult::complete: return "complete";
    case HeadResult::need_more: return "need_more";
    case HeadResult::too_big: return "too_big";
    case HeadResult::bad: return "bad";
  }
  return "?";
}

TEST(RequestHead, StartLinesFieldsAndLineEnds) {
  struct Case {
    std::string text;
    HeadResult result;
    std::string method, target;
    int version;
    std::size_t fields;
  };
  const std::string curl = "GET /hello.txt HTTP/1.1\r\nUser-Agent: curl/7.64.1\r\nHost: www.example.com\r\n"
                           "Accept-Language: en, mi\r\n\r\n";
  const Case cases[] = {
      // The forms of a request target, from RFC 9112.
      {curl, HeadResult::complete, "GET", "/hello.txt", 11, 3},
      {"GET http://www.example.org/pub/WWW/TheProject.html HTTP/1.1\r\nHost: www.example.org\r\n\r\n",
       HeadResult::complete, "GET", "http://www.example.org/pub/WWW/TheProject.html", 11, 1},
      {"CONNECT server.example.com:80 HTTP/1.1\r\nHost: server.example.com\r\n\r\n", HeadResult::complete,
       "CONNECT", "server.example.com:80", 11, 1},
      {"OPTIONS * HTTP/1.1\r\nHost: www.example.org:8001\r\n\r\n", HeadResult::complete, "OPTIONS", "*", 11, 1},
      {"GET / HTTP/2.0\r\n\r\n", HeadResult::complete, "GET", "/", 20, 0},  // the caller answers 505
      // A simple request is a head by itself; only GET was ever one.
      {"GET /index.html\r\n", HeadResult::complete, "GET", "/index.html", 9, 0},
      {"POST /form\r\n", HeadResult::bad, "", "", 0, 0},
      // LF alone ends a line, and blank lines before the request are skipped.
      {"GET / HTTP/1.0\n\n", HeadResult::complete, "GET", "/", 10, 0},
      {"\r\n\nGET / HTTP/1.0\r\nA: b\n\r\n", HeadResult::complete, "GET", "/", 10, 1},
      // A CR that ends nothing, folding, and white space where none belongs.
      {"GET / HTTP/1.1\rHost: h\r\n\r\n", HeadResult::bad, "", "", 0, 0},
      {"GET / HTTP/1.1\r\nX: a\rb\r\n\r\n", HeadResult::bad, "", "", 0, 0},
      {"GET / HTTP/1.1\r\nX: a\r\n b\r\n\r\n", HeadResult::bad, "", "", 0, 0},
      {"GET / HTTP/1.1\r\n Host: h\r\n\r\n", HeadResult::bad, "", "", 0, 0},
      {"GET / HTTP/1.1\r\nHost : h\r\n\r\n", HeadResult::bad, "", "", 0, 0},
      {"GET / HTTP/1.1\r\nHost h\r\n\r\n", HeadResult::bad, "", "", 0, 0},
      {"GET / HTTP/1.1\r\n: h\r\n\r\n", HeadResult::bad, "", "", 0, 0},
      {std::string("GET / HTTP/1.1\r\nX: a\0b\r\n\r\n", 26), HeadResult::bad, "", "", 0, 0},
      {"GET  / HTTP/1.1\r\n\r\n", HeadResult::bad, "", "", 0, 0},
      {"GET / HTTP/1.1 \r\n\r\n", HeadResult::bad, "", "", 0, 0},
      {"GET /a\tb HTTP/1.1\r\n\r\n", HeadResult::bad, "", "", 0, 0},
      {"GE(T / HTTP/1.1\r\n\r\n", HeadResult::bad, "", "", 0, 0},
      {"GET / http/1.1\r\n\r\n", HeadResult::bad, "", "", 0, 0},
      {"GET / HTTP/1.10\r\n\r\n", HeadResult::bad, "", "", 0, 0},
      // Not yet whole, a CR whose LF may follow included.
      {"GET / HTTP/1.1\r\nHost: h\r\n", HeadResult::need_more, "", "", 0, 0},
      {"GET / HTTP/1.1\r\nHost: h\r\n\r", HeadResult::need_more, "", "", 0, 0},
  };
  for (const Case& c : cases) {
    RequestParser p;
    HeadResult r = p.parse(c.text);
    EXPECT_STREQ(name(r), name(c.result)) << c.text;
    if (r != HeadResult::complete) continue;
    EXPECT_EQ(p.head.method, c.method) << c.text;
    EXPECT_EQ(p.head.target, c.target) << c.text;
    EXPECT_EQ(p.head.version, c.version) << c.text;
    EXPECT_EQ(p.head.headers.size(), c.fields) << c.text;
    EXPECT_EQ(p.used(), c.text.size()) << c.text;
  }
}

TEST(RequestHead, ResumesOneByteAtATimeAndStopsAtTheBlankLine) {
  const std::string head = "POST /f HTTP/1.1\r\nHost: h\r\nContent-Length: 3\r\n\r\n";
  const std::string text = head + "abcGET / HTTP/1.1\r\n";
  RequestParser p;
  for (std::size_t n = 1; n < head.size(); ++n)
    ASSERT_EQ(p.parse(std::string_view(text).substr(0, n)), HeadResult::need_more) << n;
  ASSERT_EQ(p.parse(text), HeadResult::complete);
  EXPECT_EQ(p.used(), head.size());
  EXPECT_EQ(p.head.headers.get("content-length"), "3");
  EXPECT_EQ(p.parse(text), HeadResult::complete);  // asked again, the same

  // A bad line is reported as soon as it is whole, not when the head ends.
  RequestParser early;
  EXPECT_EQ(early.parse("GET / HTTP/1.1\r\nHost : h\r\n"), HeadResult::bad);
  EXPECT_EQ(early.parse("GET / HTTP/1.1\r\nHost : h\r\n\r\n"), HeadResult::bad);
  EXPECT_FALSE(early.error().empty());
}

TEST(RequestHead, LimitsOnBytesAndFields) {
  const HeadLimits limits{.max_bytes = 64, .max_fields = 2};
  const std::string line = "GET / HTTP/1.1\r\n";  // 16 bytes
  struct Case {
    std::string text;
    HeadResult result;
  } cases[] = {
      {line + "A: " + std::string(41, 'x') + "\r\n\r\n", HeadResult::complete},  // exactly 64
      {line + "A: " + std::string(42, 'x') + "\r\n\r\n", HeadResult::too_big},
      {line + "A: " + std::string(100, 'x'), HeadResult::too_big},  // no line end needed to know
      {std::string(65, '\n'), HeadResult::too_big},                 // blank lines count too
      {line + "A: 1\r\nB: 2\r\n\r\n", HeadResult::complete},
      {line + "A: 1\r\nB: 2\r\nC: 3\r\n\r\n", HeadResult::too_big},
  };
  for (const Case& c : cases) {
    RequestParser p(limits);
    EXPECT_STREQ(name(p.parse(c.text)), name(c.result)) << c.text;
  }
}

TEST(ResponseHead, StatusLinesAndFolding) {
  const std::string folding = "HTTP/1.1 200 OK\r\nX:  a\r\n  b \r\n\tc\r\n\r\n";
  struct Case {
    std::string text;
    HeadResult result;
    int status;
    std::string reason;
  } cases[] = {
      {"HTTP/1.1 200 OK\r\nContent-Length: 5\r\n\r\nhello", HeadResult::complete, 200, "OK"},
      {"HTTP/1.0 404\r\n\r\n", HeadResult::complete, 404, ""},
      {"HTTP/1.1 200 \r\n\r\n", HeadResult::complete, 200, ""},
      {"HTTP/1.1 503 Service\tGone Away\r\n\r\n", HeadResult::complete, 503, "Service\tGone Away"},
      {"HTTP/1.1 20 OK\r\n\r\n", HeadResult::bad, 0, ""},
      {"HTTP/1.1 200 O\x01K\r\n\r\n", HeadResult::bad, 0, ""},
      {"HTTP/1.1 600 Odd\r\n\r\n", HeadResult::bad, 0, ""},
      {"HTTP/1.1 099 Odd\r\n\r\n", HeadResult::bad, 0, ""},
      {"HTTP/1.1 200OK\r\n\r\n", HeadResult::bad, 0, ""},
      {"ICY 200 OK\r\n\r\n", HeadResult::bad, 0, ""},
      {folding, HeadResult::complete, 200, "OK"},
  };
  for (const Case& c : cases) {
    ResponseParser p;
    HeadResult r = p.parse(c.text);
    EXPECT_STREQ(name(r), name(c.result)) << c.text;
    if (r != HeadResult::complete) continue;
    EXPECT_EQ(p.head.status, c.status) << c.text;
    EXPECT_EQ(p.head.reason, c.reason) << c.text;
    EXPECT_EQ(p.used(), c.text.find("\r\n\r\n") + 4) << c.text;
  }
  ResponseParser folded;
  ASSERT_EQ(folded.parse(folding), HeadResult::complete);
  EXPECT_EQ(folded.head.headers.get("x"), "a b c");  // obsolete folding joined with one blank
}

RequestHead request(int version, std::initializer_list<std::pair<const char*, const char*>> fields) {
  RequestHead head{.method = "POST", .target = "/", .version = version, .headers = {}};
  for (const auto& [n, v] : fields) head.headers.add(n, v);
  return head;
}

TEST(Framing, RequestsThatCouldSmuggleAreBad) {
  struct Case {
    RequestHead head;
    bool ok;
    BodyKind body;
    std::uint64_t length;
    bool keep_alive;
  } cases[] = {
      {request(11, {{"Host", "h"}}), true, BodyKind::none, 0, true},
      {request(11, {{"Host", "h"}, {"Content-Length", "5"}}), true, BodyKind::length, 5, true},
      {request(11, {{"Host", "h"}, {"Content-Length", "5, 5"}, {"Content-Length", "5"}}), true, BodyKind::length, 5,
       true},
      {request(11, {{"Host", "h"}, {"Content-Length", "0"}}), true, BodyKind::none, 0, true},
      {request(11, {{"Host", "h"}, {"Transfer-Encoding", "Chunked"}}), true, BodyKind::chunked, 0, true},
      {request(11, {{"Host", "h"}, {"Connection", "close"}}), true, BodyKind::none, 0, false},
      {request(10, {}), true, BodyKind::none, 0, false},
      {request(10, {{"Connection", "Keep-Alive, x"}}), true, BodyKind::none, 0, true},
      {request(9, {}), true, BodyKind::none, 0, false},
      // Two lengths, or a length that is not plainly a number.
      {request(11, {{"Host", "h"}, {"Content-Length", "5"}, {"Content-Length", "6"}}), false, {}, 0, false},
      {request(11, {{"Host", "h"}, {"Content-Length", "5, 6"}}), false, {}, 0, false},
      {request(11, {{"Host", "h"}, {"Content-Length", "abc"}}), false, {}, 0, false},
      {request(11, {{"Host", "h"}, {"Content-Length", "-1"}}), false, {}, 0, false},
      {request(11, {{"Host", "h"}, {"Content-Length", "+5"}}), false, {}, 0, false},
      {request(11, {{"Host", "h"}, {"Content-Length", "0x5"}}), false, {}, 0, false},
      {request(11, {{"Host", "h"}, {"Content-Length", "5 5"}}), false, {}, 0, false},
      {request(11, {{"Host", "h"}, {"Content-Length", ""}}), false, {}, 0, false},
      {request(11, {{"Host", "h"}, {"Content-Length", "99999999999999999999999"}}), false, {}, 0, false},
      // Transfer-Encoding beside a length, in 1.0, or not chunked alone.
      {request(11, {{"Host", "h"}, {"Transfer-Encoding", "chunked"}, {"Content-Length", "5"}}), false, {}, 0, false},
      {request(11, {{"Host", "h"}, {"Content-Length", "5"}, {"Transfer-Encoding", "chunked"}}), false, {}, 0, false},
      {request(10, {{"Transfer-Encoding", "chunked"}}), false, {}, 0, false},
      {request(11, {{"Host", "h"}, {"Transfer-Encoding", "gzip, chunked"}}), false, {}, 0, false},
      {request(11, {{"Host", "h"}, {"Transfer-Encoding", "chunked, chunked"}}), false, {}, 0, false},
      {request(11, {{"Host", "h"}, {"Transfer-Encoding", "gzip"}, {"Transfer-Encoding", "chunked"}}), false, {}, 0,
       false},
      {request(11, {{"Host", "h"}, {"Transfer-Encoding", ""}}), false, {}, 0, false},
      // Not one Host.
      {request(11, {}), false, {}, 0, false},
      {request(10, {{"Host", "a"}, {"Host", "b"}}), false, {}, 0, false},
  };
  for (const Case& c : cases) {
    Framing f = request_framing(c.head);
    std::string what = c.head.headers.text() + "version " + std::to_string(c.head.version);
    EXPECT_EQ(f.ok(), c.ok) << what;
    EXPECT_EQ(f.keep_alive, c.keep_alive) << what;
    if (!c.ok) continue;
    EXPECT_EQ(f.body, c.body) << what;
    EXPECT_EQ(f.length, c.length) << what;
  }
}

TEST(Framing, ResponsesByMethodStatusAndFields) {
  struct Case {
    int version, status;
    const char* method;
    std::initializer_list<std::pair<const char*, const char*>> fields;
    bool ok;
    BodyKind body;
    bool keep_alive;
  } cases[] = {
      {11, 200, "HEAD", {{"Content-Length", "100"}}, true, BodyKind::none, true},
      {11, 204, "GET", {{"Content-Length", "100"}}, true, BodyKind::none, true},
      {11, 304, "GET", {{"Transfer-Encoding", "chunked"}}, true, BodyKind::none, true},
      {11, 101, "GET", {}, true, BodyKind::none, true},
      {11, 200, "CONNECT", {}, true, BodyKind::none, true},
      {11, 200, "GET", {{"Content-Length", "10"}}, true, BodyKind::length, true},
      {11, 200, "GET", {{"Content-Length", "0"}}, true, BodyKind::none, true},
      {10, 200, "GET", {{"Content-Length", "3"}, {"Connection", "keep-alive"}}, true, BodyKind::length, true},
      {10, 200, "GET", {{"Content-Length", "3"}}, true, BodyKind::length, false},
      {11, 200, "GET", {{"Transfer-Encoding", "chunked"}}, true, BodyKind::chunked, true},
      {11, 200, "GET", {{"Transfer-Encoding", "gzip, chunked"}}, true, BodyKind::chunked, true},
      {11, 200, "GET", {{"Transfer-Encoding", "chunked"}, {"Content-Length", "10"}}, true, BodyKind::chunked, false},
      {11, 200, "GET", {{"Transfer-Encoding", "gzip"}}, true, BodyKind::until_close, false},
      {10, 200, "GET", {{"Transfer-Encoding", "chunked"}}, true, BodyKind::until_close, false},
      {11, 200, "GET", {}, true, BodyKind::until_close, false},
      {11, 200, "GET", {{"Content-Length", "1x"}}, false, {}, false},
      {11, 200, "GET", {{"Content-Length", "1"}, {"Content-Length", "2"}}, false, {}, false},
      {11, 200, "GET", {{"Transfer-Encoding", "chunked, gzip"}}, false, {}, false},
  };
  for (const Case& c : cases) {
    ResponseHead head{.version = c.version, .status = c.status, .reason = {}, .headers = {}};
    for (const auto& [n, v] : c.fields) head.headers.add(n, v);
    Framing f = response_framing(head, c.method);
    std::string what = std::string(c.method) + " " + std::to_string(c.status) + "\n" + head.headers.text();
    EXPECT_EQ(f.ok(), c.ok) << what;
    EXPECT_EQ(f.keep_alive, c.keep_alive) << what;
    if (c.ok) EXPECT_EQ(f.body, c.body) << what;
  }
}

TEST(HeaderList, OrderDuplicatesCaseAndHopByHop) {
  HeaderList h;
  h.add("Host", "h");
  h.add("Connection", "keep-alive, X-Private");
  h.add("Accept", "a");
  h.add("x-private", "secret");
  h.add("ACCEPT", "b");
  h.add("Connection", "Transfer-Encoding, Content-Length, Host");
  h.add("Transfer-Encoding", "chunked");
  h.add("Content-Length", "4");
  for (const char* hop : {"Keep-Alive", "Proxy-Connection", "Proxy-Authorization", "Proxy-Authenticate", "TE",
                          "Trailer", "Upgrade"})
    h.add(hop, "x");
  EXPECT_EQ(h.get("accept"), "a");
  EXPECT_EQ(h.count("Accept"), 2u);
  EXPECT_EQ(h.joined("accept"), "a, b");
  EXPECT_TRUE(h.has_token("connection", "x-private"));
  EXPECT_FALSE(h.has_token("connection", "x"));
  EXPECT_EQ(h.connection_tokens(),
            (std::vector<std::string>{"keep-alive", "x-private", "transfer-encoding", "content-length", "host"}));
  h.remove_hop_by_hop();
  // The framing fields stay even when Connection names them.
  EXPECT_EQ(h.text(), "Host: h\r\nAccept: a\r\nACCEPT: b\r\nTransfer-Encoding: chunked\r\nContent-Length: 4\r\n");
  h.set("accept", "c");
  h.set("Date", "d");
  EXPECT_EQ(h.remove("HOST"), 1u);
  EXPECT_EQ(h.text(), "Accept: c\r\nTransfer-Encoding: chunked\r\nContent-Length: 4\r\nDate: d\r\n");
  EXPECT_EQ(field_parameter("multipart/form-data; charset=x ;BOUNDARY=\"a \\\"b\\\"\"", "boundary"), "a \"b\"");
  EXPECT_EQ(field_parameter("text/plain; x", "x"), std::nullopt);
}

TEST(ResponseWriter, StatusLinesAndHeadsThatCannotBeSplit) {
  EXPECT_EQ(status_line(404), "HTTP/1.1 404 Not Found\r\n");
  EXPECT_EQ(status_line(200, "Fine", 10), "HTTP/1.0 200 Fine\r\n");
  EXPECT_EQ(status_line(299), "HTTP/1.1 299 Unknown\r\n");
  ResponseHead r{.version = 11, .status = 302, .reason = "Found\r\nX: y", .headers = {}};
  r.headers.add("Location", "/a\r\nSet-Cookie: evil=1");
  r.headers.add("Bad Name", "dropped");
  r.headers.add("Content-Length", "0");
  EXPECT_EQ(write_head(r), "HTTP/1.1 302 Found  X: y\r\nLocation: /a  Set-Cookie: evil=1\r\nContent-Length: 0\r\n\r\n");
  r.version = 9;  // a simple request gets the body alone
  EXPECT_EQ(write_head(r), "");
}

}  // namespace
}  // namespace velmor::http
