#include "dns/message.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <vector>

namespace velmor::dns {
namespace {

using Bytes = std::vector<std::uint8_t>;

// A response header with one question "a.b" (type A) followed by `tail`.
Bytes with_records(std::uint16_t ancount, const Bytes& tail) {
  Bytes m = {0x12, 0x34, 0x81, 0x80, 0, 1, 0, static_cast<std::uint8_t>(ancount), 0, 0, 0, 0,
             1, 'a', 1, 'b', 0, 0, 1, 0, 1};
  for (std::uint8_t b : tail) m.push_back(b);  // (gcc 12 misjudges an insert of an empty range)
  return m;
}

DecodeResult decode_all(const Bytes& m, std::vector<Record>& records) {
  Header h;
  std::vector<Question> q;
  return decode(m, h, q, &records);
}

TEST(DnsMessage, NamesMayOnlyPointBackwardsOutOfTheirOwnPiece) {
  const Bytes base = with_records(0, {});
  // The question name at 12 is reached by a pointer from later on.
  Bytes ok = base;
  ok.insert(ok.end(), {1, 'x', 0xc0, 12});
  auto name = expand_name(ok, base.size());
  ASSERT_TRUE(name);
  EXPECT_EQ(name->first, "x.a.b");
  EXPECT_EQ(name->second, ok.size());

  Bytes self = base;
  self.insert(self.end(), {0xc0, static_cast<std::uint8_t>(base.size())});  // points at itself
  EXPECT_FALSE(skip_name(self, base.size()));
  Bytes forward = base;
  forward.insert(forward.end(), {0xc0, static_cast<std::uint8_t>(base.size() + 2), 0});
  EXPECT_FALSE(skip_name(forward, base.size()));
  // A label before the pointer, pointing back at that label: a loop.
  Bytes loop = base;
  loop.insert(loop.end(), {1, 'x', 0xc0, static_cast<std::uint8_t>(base.size())});
  EXPECT_FALSE(skip_name(loop, base.size()));
  Bytes cut = base;
  cut.insert(cut.end(), {5, 'a', 'b'});
  EXPECT_FALSE(skip_name(cut, base.size()));
}

// (Counts beyond the data, RDLENGTH past the end and an 8-byte A record are
// driven end to end in tests/test_dns.py.)
TEST(DnsMessage, RecordDataIsDecodedByType) {
  std::vector<Record> records;
  // A CNAME whose name runs past its RDATA.
  Bytes cname = {0xc0, 12, 0, 5, 0, 1, 0, 0, 0, 60, 0, 2, 1, 'c', 0xc0, 12};
  EXPECT_EQ(decode_all(with_records(1, cname), records), DecodeResult::bad_record);
  Bytes mx = {0xc0, 12, 0, 15, 0, 1, 0, 0, 0, 60, 0, 6, 0, 10, 2, 'm', 'x', 0};
  ASSERT_EQ(decode_all(with_records(1, mx), records), DecodeResult::ok);
  EXPECT_EQ(records[0].preference, 10);
  EXPECT_EQ(records[0].data, "mx");
  EXPECT_EQ(decode_all(with_records(0, Bytes(kMaxDatagram, 0)), records), DecodeResult::too_large);
}

TEST(DnsMessage, QueryCarriesOurIdentifierAndQuestion) {
  auto q = build_query(0xbeef, "Mail.Example.ORG.", rrtype::mx, kClassIn);
  ASSERT_TRUE(q);
  Header h;
  std::vector<Question> questions;
  ASSERT_EQ(decode(*q, h, questions, nullptr), DecodeResult::ok);
  EXPECT_EQ(h.id, 0xbeef);
  EXPECT_TRUE(h.rd);
  EXPECT_FALSE(h.qr);
  ASSERT_EQ(questions.size(), 1u);
  EXPECT_TRUE(same_name(questions[0].name, "mail.example.org"));
  EXPECT_EQ(questions[0].type, rrtype::mx);
  EXPECT_FALSE(build_query(1, std::string(64, 'x') + ".org", rrtype::a, kClassIn));
}

}  // namespace
}  // namespace velmor::dns
