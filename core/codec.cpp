// Base64, uuencode, the MD5 digest and the "$1$" password hash.
#include <cstring>

#include "core/util.h"

namespace velmor {

// ---- Base64 and uuencode ---------------------------------------------------------

namespace {

constexpr char kBase64[] = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";

// Three bytes (zero-padded) as four 6-bit values.
void split_group(std::string_view data, std::size_t i, int out[4]) {
  unsigned v = static_cast<unsigned char>(data[i]) << 16;
  if (i + 1 < data.size()) v |= static_cast<unsigned char>(data[i + 1]) << 8;
  if (i + 2 < data.size()) v |= static_cast<unsigned char>(data[i + 2]);
  for (int k = 0; k < 4; ++k) out[k] = static_cast<int>((v >> (18 - 6 * k)) & 0x3f);
}

}  // namespace

int base64_digit(char c) {
  if (c >= 'A' && c <= 'Z') return c - 'A';
  if (c >= 'a' && c <= 'z') return c - 'a' + 26;
  if (c >= '0' && c <= '9') return c - '0' + 52;
  if (c == '+') return 62;
  if (c == '/') return 63;
  return -1;
}

std::string base64_decode(std::string_view text) {
  std::size_t i = 0;
  while (i < text.size() && (text[i] == ' ' || text[i] == '\t')) ++i;
  std::string out;
  out.reserve(text.size() * 3 / 4);
  unsigned acc = 0;
  int bits = 0;
  for (; i < text.size(); ++i) {
    int v = base64_digit(text[i]);
    if (v < 0) break;  // "=" padding or anything else ends the data
    acc = (acc << 6) | static_cast<unsigned>(v);
    bits += 6;
    if (bits >= 8) {
      bits -= 8;
      out += static_cast<char>((acc >> bits) & 0xff);
    }
  }
  return out;
}

std::string base64_encode(std::string_view data) {
  std::string out;
  out.reserve((data.size() + 2) / 3 * 4);
  for (std::size_t i = 0; i < data.size(); i += 3) {
    int v[4];
    split_group(data, i, v);
    std::size_t have = data.size() - i;
    out += kBase64[v[0]];
    out += kBase64[v[1]];
    out += have > 1 ? kBase64[v[2]] : '=';
    out += have > 2 ? kBase64[v[3]] : '=';
  }
  return out;
}

std::string uu_encode(std::string_view data) {
  std::string out;
  out.reserve((data.size() + 2) / 3 * 4);
  for (std::size_t i = 0; i < data.size(); i += 3) {
    int v[4];
    split_group(data, i, v);
    for (int k : v) out += static_cast<char>(k + 32);
  }
  return out;
}

// ---- MD5 ---------------------------------------------------------------------------

namespace {

constexpr std::uint32_t kSine[64] = {
    0xd76aa478, 0xe8c7b756, 0x242070db, 0xc1bdceee, 0xf57c0faf, 0x4787c62a, 0xa8304613, 0xfd469501,
    0x698098d8, 0x8b44f7af, 0xffff5bb1, 0x895cd7be, 0x6b901122, 0xfd987193, 0xa679438e, 0x49b40821,
    0xf61e2562, 0xc040b340, 0x265e5a51, 0xe9b6c7aa, 0xd62f105d, 0x02441453, 0xd8a1e681, 0xe7d3fbc8,
    0x21e1cde6, 0xc33707d6, 0xf4d50d87, 0x455a14ed, 0xa9e3e905, 0xfcefa3f8, 0x676f02d9, 0x8d2a4c8a,
    0xfffa3942, 0x8771f681, 0x6d9d6122, 0xfde5380c, 0xa4beea44, 0x4bdecfa9, 0xf6bb4b60, 0xbebfbc70,
    0x289b7ec6, 0xeaa127fa, 0xd4ef3085, 0x04881d05, 0xd9d4d039, 0xe6db99e5, 0x1fa27cf8, 0xc4ac5665,
    0xf4292244, 0x432aff97, 0xab9423a7, 0xfc93a039, 0x655b59c3, 0x8f0ccc92, 0xffeff47d, 0x85845dd1,
    0x6fa87e4f, 0xfe2ce6e0, 0xa3014314, 0x4e0811a1, 0xf7537e82, 0xbd3af235, 0x2ad7d2bb, 0xeb86d391,
};
constexpr int kShift[64] = {7, 12, 17, 22, 7, 12, 17, 22, 7, 12, 17, 22, 7, 12, 17, 22,
                            5, 9,  14, 20, 5, 9,  14, 20, 5, 9,  14, 20, 5, 9,  14, 20,
                            4, 11, 16, 23, 4, 11, 16, 23, 4, 11, 16, 23, 4, 11, 16, 23,
                            6, 10, 15, 21, 6, 10, 15, 21, 6, 10, 15, 21, 6, 10, 15, 21};

inline std::uint32_t rotl(std::uint32_t x, int n) { return (x << n) | (x >> (32 - n)); }

void md5_block(std::uint32_t state[4], const unsigned char block[64]) {
  std::uint32_t m[16];
  for (int i = 0; i < 16; ++i) {
    m[i] = static_cast<std::uint32_t>(block[i * 4]) | static_cast<std::uint32_t>(block[i * 4 + 1]) << 8 |
           static_cast<std::uint32_t>(block[i * 4 + 2]) << 16 | static_cast<std::uint32_t>(block[i * 4 + 3]) << 24;
  }
  std::uint32_t a = state[0], b = state[1], c = state[2], d = state[3];
  for (int i = 0; i < 64; ++i) {
    std::uint32_t f;
    int g;
    if (i < 16) {
      f = (b & c) | (~b & d);
      g = i;
    } else if (i < 32) {
      f = (d & b) | (~d & c);
      g = (5 * i + 1) % 16;
    } else if (i < 48) {
      f = b ^ c ^ d;
      g = (3 * i + 5) % 16;
    } else {
      f = c ^ (b | ~d);
      g = (7 * i) % 16;
    }
    std::uint32_t next = b + rotl(a + f + kSine[i] + m[g], kShift[i]);
    a = d;
    d = c;
    c = b;
    b = next;
  }
  state[0] += a;
  state[1] += b;
  state[2] += c;
  state[3] += d;
}

std::string digest_of(Md5& ctx) {
  unsigned char d[16];
  md5_final(ctx, d);
  return std::string(reinterpret_cast<const char*>(d), 16);
}

}  // namespace

void md5_init(Md5& ctx) {
  ctx.state[0] = 0x67452301;
  ctx.state[1] = 0xefcdab89;
  ctx.state[2] = 0x98badcfe;
  ctx.state[3] = 0x10325476;
  ctx.count = 0;
}

void md5_update(Md5& ctx, std::string_view data) {
  if (data.empty()) return;  // an empty view may have no data pointer at all
  std::size_t used = ctx.count % 64;
  ctx.count += data.size();
  const auto* p = reinterpret_cast<const unsigned char*>(data.data());
  std::size_t n = data.size();
  if (used) {
    std::size_t take = std::min(n, 64 - used);
    std::memcpy(ctx.buffer + used, p, take);
    p += take;
    n -= take;
    if (used + take < 64) return;
    md5_block(ctx.state, ctx.buffer);
  }
  for (; n >= 64; p += 64, n -= 64) md5_block(ctx.state, p);
  if (n) std::memcpy(ctx.buffer, p, n);
}

void md5_final(Md5& ctx, unsigned char digest[16]) {
  std::uint64_t bits = ctx.count * 8;
  static const unsigned char pad[64] = {0x80};
  std::size_t used = ctx.count % 64;
  md5_update(ctx, std::string_view(reinterpret_cast<const char*>(pad), used < 56 ? 56 - used : 120 - used));
  unsigned char length[8];
  for (int i = 0; i < 8; ++i) length[i] = static_cast<unsigned char>(bits >> (8 * i));
  md5_update(ctx, std::string_view(reinterpret_cast<const char*>(length), 8));
  for (int i = 0; i < 16; ++i) digest[i] = static_cast<unsigned char>(ctx.state[i / 4] >> (8 * (i % 4)));
}

std::string md5_hex(std::string_view data) {
  Md5 ctx;
  md5_init(ctx);
  md5_update(ctx, data);
  std::string digest = digest_of(ctx);
  static constexpr char hex[] = "0123456789abcdef";
  std::string out;
  for (unsigned char c : digest) {
    out += hex[c >> 4];
    out += hex[c & 15];
  }
  return out;
}

// ---- the "$1$" password hash --------------------------------------------------------

std::string md5_crypt(std::string_view password, std::string_view setting) {
  static constexpr std::string_view magic = "$1$";
  static constexpr char itoa64[] = "./0123456789ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz";
  if (setting.substr(0, magic.size()) == magic) setting.remove_prefix(magic.size());
  std::string_view salt = setting.substr(0, std::min(setting.find('$'), std::min<std::size_t>(setting.size(), 8)));

  Md5 alt;
  md5_init(alt);
  md5_update(alt, password);
  md5_update(alt, salt);
  md5_update(alt, password);
  std::string alt_sum = digest_of(alt);

  Md5 ctx;
  md5_init(ctx);
  md5_update(ctx, password);
  md5_update(ctx, magic);
  md5_update(ctx, salt);
  for (std::size_t left = password.size(); left > 0; left -= std::min<std::size_t>(left, 16))
    md5_update(ctx, std::string_view(alt_sum).substr(0, std::min<std::size_t>(left, 16)));
  for (std::size_t i = password.size(); i; i >>= 1)
    md5_update(ctx, (i & 1) ? std::string_view("\0", 1) : password.substr(0, 1));
  std::string sum = digest_of(ctx);

  for (int i = 0; i < 1000; ++i) {
    Md5 round;
    md5_init(round);
    if (i & 1) md5_update(round, password);
    else md5_update(round, sum);
    if (i % 3) md5_update(round, salt);
    if (i % 7) md5_update(round, password);
    if (i & 1) md5_update(round, sum);
    else md5_update(round, password);
    sum = digest_of(round);
  }

  std::string out = std::string(magic) + std::string(salt) + "$";
  auto put = [&](unsigned v, int n) {
    while (n-- > 0) {
      out += itoa64[v & 0x3f];
      v >>= 6;
    }
  };
  auto byte = [&](int i) { return static_cast<unsigned>(static_cast<unsigned char>(sum[i])); };
  static constexpr int groups[5][3] = {{0, 6, 12}, {1, 7, 13}, {2, 8, 14}, {3, 9, 15}, {4, 10, 5}};
  for (const auto& g : groups) put(byte(g[0]) << 16 | byte(g[1]) << 8 | byte(g[2]), 4);
  put(byte(11), 2);
  return out;
}

bool constant_time_equals(std::string_view a, std::string_view b) {
  unsigned char diff = a.size() == b.size() ? 0 : 1;
  std::size_t n = std::max(a.size(), b.size());
  for (std::size_t i = 0; i < n; ++i) {
    unsigned char x = i < a.size() ? static_cast<unsigned char>(a[i]) : 0;
    unsigned char y = i < b.size() ? static_cast<unsigned char>(b[i]) : 0;
    diff = static_cast<unsigned char>(diff | (x ^ y));
  }
  return diff == 0;
}

}  // namespace velmor
