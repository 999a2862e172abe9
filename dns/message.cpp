// DNS messages. The query is built by the resolver library (res_mkquery,
// which encodes the name with dn_comp) and names are expanded with
// dn_expand, but only after skip_name has walked the name itself under
// stricter rules than the library's: every label and pointer inside the
// datagram, pointers only backwards, 255 octets at most.
#include "dns/message.h"

#include <arpa/nameser.h>
#include <netinet/in.h>
#include <resolv.h>

#include <array>

namespace velmor::dns {

namespace {

std::uint16_t get16(std::span<const std::uint8_t> msg, std::size_t pos) {
  return static_cast<std::uint16_t>((msg[pos] << 8) | msg[pos + 1]);
}

std::uint32_t get32(std::span<const std::uint8_t> msg, std::size_t pos) {
  return (std::uint32_t{msg[pos]} << 24) | (std::uint32_t{msg[pos + 1]} << 16) |
         (std::uint32_t{msg[pos + 2]} << 8) | std::uint32_t{msg[pos + 3]};
}

char ascii_lower(char c) { return c >= 'A' && c <= 'Z' ? static_cast<char>(c - 'A' + 'a') : c; }

// A name that lies inside RDATA must end exactly where the RDATA ends.
bool name_fills(std::span<const std::uint8_t> msg, std::size_t pos, std::size_t rdata_end, std::string& out) {
  auto name = expand_name(msg, pos);
  if (!name || name->second != rdata_end) return false;
  out = std::move(name->first);
  return true;
}

}  // namespace

bool decode_header(std::span<const std::uint8_t> msg, Header& out) {
  if (msg.size() < kHeaderSize) return false;
  out.id = get16(msg, 0);
  out.qr = (msg[2] & 0x80) != 0;
  out.opcode = (msg[2] >> 3) & 0x0f;
  out.tc = (msg[2] & 0x02) != 0;
  out.rd = (msg[2] & 0x01) != 0;
  out.rcode = msg[3] & 0x0f;
  out.qdcount = get16(msg, 4);
  out.ancount = get16(msg, 6);
  out.nscount = get16(msg, 8);
  out.arcount = get16(msg, 10);
  return true;
}

std::optional<std::size_t> skip_name(std::span<const std::uint8_t> msg, std::size_t pos) {
  std::optional<std::size_t> end;
  std::size_t cur = pos;
  std::size_t piece_start = pos;  // where the walk last started or jumped to
  std::size_t octets = 0;
  for (;;) {
    if (cur >= msg.size()) return std::nullopt;
    const std::uint8_t c = msg[cur];
    if (c == 0) {
      if (octets + 1 > NS_MAXCDNAME) return std::nullopt;
      return end ? *end : cur + 1;
    }
    switch (c & 0xc0) {
      case 0x00:
        if (c + 1u > msg.size() - cur) return std::nullopt;
        octets += c + 1u;
        if (octets + 1 > NS_MAXCDNAME) return std::nullopt;
        cur += c + 1u;
        break;
      case 0xc0: {
        if (cur + 1 >= msg.size()) return std::nullopt;
        const std::size_t target = ((c & 0x3fu) << 8) | msg[cur + 1];
        if (!end) end = cur + 2;
        // Only backwards, and before the piece that holds the pointer: each
        // jump lands earlier than the last, so the walk always ends.
        if (target >= piece_start) return std::nullopt;
        cur = piece_start = target;
        break;
      }
      default:
        return std::nullopt;  // the extended label types are not used
    }
  }
}

std::optional<std::pair<std::string, std::size_t>> expand_name(std::span<const std::uint8_t> msg,
                                                               std::size_t pos) {
  auto end = skip_name(msg, pos);
  if (!end) return std::nullopt;
  std::array<char, NS_MAXDNAME> text{};
  int used = dn_expand(msg.data(), msg.data() + msg.size(), msg.data() + pos, text.data(),
                       static_cast<int>(text.size()));
  if (used < 0 || static_cast<std::size_t>(used) != *end - pos) return std::nullopt;
  return std::pair<std::string, std::size_t>{std::string(text.data()), *end};
}

DecodeResult decode(std::span<const std::uint8_t> msg, Header& header, std::vector<Question>& questions,
                    std::vector<Record>* records) {
  if (msg.size() > kMaxDatagram) return DecodeResult::too_large;
  if (!decode_header(msg, header)) return DecodeResult::too_short;
  std::size_t pos = kHeaderSize;
  questions.clear();
  for (unsigned i = 0; i < header.qdcount; ++i) {
    auto name = expand_name(msg, pos);
    if (!name || msg.size() - name->second < 4) return DecodeResult::bad_question;
    pos = name->second;
    questions.push_back({std::move(name->first), get16(msg, pos), get16(msg, pos + 2)});
    pos += 4;
  }
  if (!records) return DecodeResult::ok;
  records->clear();
  const unsigned counts[] = {header.ancount, header.nscount, header.arcount};
  for (int s = 0; s < 3; ++s) {
    for (unsigned i = 0; i < counts[s]; ++i) {
      Record r;
      r.section = static_cast<Section>(s);
      auto owner = expand_name(msg, pos);
      if (!owner) return DecodeResult::bad_name;
      r.name = std::move(owner->first);
      pos = owner->second;
      if (msg.size() - pos < 10) return DecodeResult::bad_record;
      r.type = get16(msg, pos);
      r.rclass = get16(msg, pos + 2);
      r.ttl = get32(msg, pos + 4);
      if (r.ttl & 0x80000000u) r.ttl = 0;  // a negative TTL means "do not keep"
      const std::size_t rdlength = get16(msg, pos + 8);
      pos += 10;
      if (rdlength > msg.size() - pos) return DecodeResult::bad_record;
      const std::size_t rdata_end = pos + rdlength;
      switch (r.type) {
        case rrtype::a:
          if (rdlength != 4) return DecodeResult::bad_record;
          r.data.assign(reinterpret_cast<const char*>(msg.data() + pos), 4);
          break;
        case rrtype::cname:
        case rrtype::ptr:
        case rrtype::ns:
          if (!name_fills(msg, pos, rdata_end, r.data)) return DecodeResult::bad_record;
          break;
        case rrtype::mx:
          if (rdlength < 3) return DecodeResult::bad_record;
          r.preference = get16(msg, pos);
          if (!name_fills(msg, pos + 2, rdata_end, r.data)) return DecodeResult::bad_record;
          break;
        default:
          r.data.assign(reinterpret_cast<const char*>(msg.data() + pos), rdlength);
          break;
      }
      pos = rdata_end;
      records->push_back(std::move(r));
    }
  }
  return DecodeResult::ok;
}

std::optional<std::vector<std::uint8_t>> build_query(std::uint16_t id, std::string_view name,
                                                     std::uint16_t type, std::uint16_t qclass) {
  if (name.empty() || name.find('\0') != std::string_view::npos || name.size() > NS_MAXDNAME) return std::nullopt;
  std::string text(name);
  std::vector<std::uint8_t> packet(kMaxDatagram);
  int n = res_mkquery(ns_o_query, text.c_str(), qclass, type, nullptr, 0, nullptr, packet.data(),
                      static_cast<int>(packet.size()));
  if (n < static_cast<int>(kHeaderSize)) return std::nullopt;
  packet.resize(static_cast<std::size_t>(n));
  // The identifier is ours; the flags are exactly "query, recursion
  // desired", whatever the library's own options say.
  packet[0] = static_cast<std::uint8_t>(id >> 8);
  packet[1] = static_cast<std::uint8_t>(id & 0xff);
  packet[2] = 0x01;
  packet[3] = 0x00;
  Header h;
  decode_header(packet, h);
  if (h.qdcount != 1 || h.ancount || h.nscount || h.arcount) return std::nullopt;
  return packet;
}

std::string_view without_final_dot(std::string_view name) {
  if (name.size() > 1 && name.back() == '.') name.remove_suffix(1);
  return name;
}

bool same_name(std::string_view a, std::string_view b) {
  a = without_final_dot(a);
  b = without_final_dot(b);
  if (a.size() != b.size()) return false;
  for (std::size_t i = 0; i < a.size(); ++i)
    if (ascii_lower(a[i]) != ascii_lower(b[i])) return false;
  return true;
}

std::string name_key(std::string_view name) {
  name = without_final_dot(name);
  std::string key(name);
  for (char& c : key) c = ascii_lower(c);
  return key;
}

}  // namespace velmor::dns
