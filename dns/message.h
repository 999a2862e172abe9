// DNS messages: building a standard query and decoding a response.
//
// Decoding never reads outside the datagram: every count, name, field and
// RDLENGTH is checked against its end, a compression pointer must point
// before the start of the name piece that holds it (so no loop and no
// forward jump is followed), and a name expands to at most 255 octets.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

namespace velmor::dns {

// The largest datagram the resolver decodes; it asks for nothing larger
// (no EDNS), so a bigger one is dropped rather than decoded cut.
inline constexpr std::size_t kMaxDatagram = 512;
inline constexpr std::size_t kHeaderSize = 12;

namespace rrtype {
inline constexpr std::uint16_t a = 1;
inline constexpr std::uint16_t ns = 2;
inline constexpr std::uint16_t cname = 5;
inline constexpr std::uint16_t ptr = 12;
inline constexpr std::uint16_t mx = 15;
inline constexpr std::uint16_t any = 255;
}  // namespace rrtype
inline constexpr std::uint16_t kClassIn = 1;
inline constexpr std::uint16_t kClassAny = 255;

namespace rcode {
inline constexpr int no_error = 0;
inline constexpr int name_error = 3;
}  // namespace rcode

struct Header {
  std::uint16_t id = 0;
  bool qr = false;  // a response
  int opcode = 0;
  bool tc = false;  // truncated
  bool rd = false;
  int rcode = 0;
  std::uint16_t qdcount = 0, ancount = 0, nscount = 0, arcount = 0;
};

struct Question {
  std::string name;  // expanded text, without the final dot
  std::uint16_t type = 0;
  std::uint16_t qclass = 0;
};

enum class Section { answer, authority, additional };

// One resource record, its data decoded by type: A exactly 4 bytes (network
// order); CNAME, PTR and NS the expanded name; MX the preference and the
// expanded exchange name; every other type the raw RDATA.
struct Record {
  Section section = Section::answer;
  std::string name;
  std::uint16_t type = 0;
  std::uint16_t rclass = 0;
  std::uint32_t ttl = 0;
  std::uint16_t preference = 0;  // MX only
  std::string data;
};

enum class DecodeResult {
  ok,
  too_short,      // fewer than 12 bytes
  too_large,      // more than kMaxDatagram
  bad_question,   // a question name or its fields run past the end or do not expand
  bad_name,       // a record's owner name does not expand
  bad_record,     // a record's fields, RDLENGTH or RDATA are malformed
};

// The header alone; false when the datagram is shorter than a header.
bool decode_header(std::span<const std::uint8_t> msg, Header& out);

// Header and questions; with `records` also every resource record of the
// three sections. Anything malformed fails the whole datagram.
DecodeResult decode(std::span<const std::uint8_t> msg, Header& header, std::vector<Question>& questions,
                    std::vector<Record>* records);

// The offset just past the name at `pos` as it sits in the message, or
// nullopt when the name is malformed (see the top of this file).
std::optional<std::size_t> skip_name(std::span<const std::uint8_t> msg, std::size_t pos);
// The name at `pos` expanded to text (the resolver library's presentation
// form, no final dot), with the offset just past it.
std::optional<std::pair<std::string, std::size_t>> expand_name(std::span<const std::uint8_t> msg,
                                                               std::size_t pos);

// A standard query (opcode QUERY, recursion desired, one question) with the
// given identifier. nullopt when the name cannot be encoded.
std::optional<std::vector<std::uint8_t>> build_query(std::uint16_t id, std::string_view name,
                                                     std::uint16_t type, std::uint16_t qclass);

std::string_view without_final_dot(std::string_view name);
// ASCII case-insensitive equality of two names, a final dot ignored on both.
bool same_name(std::string_view a, std::string_view b);
// The cache key of a name: lower case, without a final dot.
std::string name_key(std::string_view name);

}  // namespace velmor::dns
