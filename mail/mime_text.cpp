#include "mail/mime_text.h"

#include <iconv.h>

#include <algorithm>
#include <cerrno>
#include <utility>
#include <vector>

#include "core/util.h"

namespace velmor {

namespace {

constexpr std::string_view kReplacement = "\xEF\xBF\xBD";  // U+FFFD
constexpr std::size_t kCharsetName = 40;
constexpr std::size_t kConverters = 16;

char32_t fold(char32_t c) {
  if (c < 0x80) return c >= 'A' && c <= 'Z' ? c + 32 : c;
  if (c >= 0xC0 && c <= 0xDE && c != 0xD7) return c + 32;
  if (c >= 0x100 && c <= 0x17F) {
    // Latin Extended-A: capitals and small letters in pairs, the capital
    // first; three runs start the pairs one place later.
    if (c == 0x130) return 'i';
    if (c == 0x178) return 0xFF;
    if (c == 0x131 || c == 0x138 || c == 0x149 || c == 0x17F) return c;
    bool odd_capitals = (c >= 0x139 && c <= 0x148) || (c >= 0x179 && c <= 0x17E);
    return (c & 1) == (odd_capitals ? 1u : 0u) ? c + 1 : c;
  }
  if (c >= 0x391 && c <= 0x3AB && c != 0x3A2) return c + 32;  // Greek
  if (c >= 0x400 && c <= 0x40F) return c + 0x50;              // Cyrillic Ѐ..Џ
  if (c >= 0x410 && c <= 0x42F) return c + 0x20;              // А..Я
  if ((c >= 0x460 && c <= 0x481) || (c >= 0x48A && c <= 0x4BF) || (c >= 0x4D0 && c <= 0x52F))
    return (c & 1) ? c : c + 1;
  if (c == 0x4C0) return 0x4CF;
  if (c >= 0x4C1 && c <= 0x4CE) return (c & 1) ? c + 1 : c;
  return c;
}

void put_utf8(std::string& out, char32_t c) {
  if (c < 0x80) {
    out += static_cast<char>(c);
  } else {  // every folded letter lies below U+0800
    out += static_cast<char>(0xC0 | (c >> 6));
    out += static_cast<char>(0x80 | (c & 0x3F));
  }
}

// A charset's name as iconv is asked for it: lower case, its RFC 2231
// language cut off; empty when it holds anything but letters, digits and
// "-_.:+", so a sender's text never reaches iconv's module loader as a path.
std::string charset_key(std::string_view charset) {
  charset = trim_blanks(charset.substr(0, charset.find('*')));
  if (charset.empty() || charset.size() > kCharsetName) return {};
  std::string key = str_lower(charset);
  bool plain = std::all_of(key.begin(), key.end(), [](char c) {
    return (c >= 'a' && c <= 'z') || (c >= '0' && c <= '9') || c == '-' || c == '_' || c == '.' || c == ':' ||
           c == '+';
  });
  return plain ? key : std::string();
}

// The converters opened so far (a failed open is kept too, so an unknown
// name is asked about once), the oldest let go past a few.
struct Converters {
  std::vector<std::pair<std::string, iconv_t>> open;
  ~Converters() {
    for (auto& [name, cd] : open)
      if (cd != reinterpret_cast<iconv_t>(-1)) iconv_close(cd);
  }
  iconv_t get(const std::string& key) {
    for (auto& [name, cd] : open)
      if (name == key) return cd;
    if (open.size() >= kConverters) {
      if (open.front().second != reinterpret_cast<iconv_t>(-1)) iconv_close(open.front().second);
      open.erase(open.begin());
    }
    iconv_t cd = iconv_open("UTF-8", key.c_str());
    open.emplace_back(key, cd);
    return cd;
  }
};

}  // namespace

void utf8_fold_append(std::string& out, std::string_view text) {
  out.reserve(out.size() + text.size());
  for (std::size_t i = 0; i < text.size(); ++i) {
    auto b = static_cast<unsigned char>(text[i]);
    if (b < 0x80) {
      out += static_cast<char>(b >= 'A' && b <= 'Z' ? b + 32 : b);
      continue;
    }
    // Only two-byte sequences hold letters that fold; the rest is copied.
    auto next = i + 1 < text.size() ? static_cast<unsigned char>(text[i + 1]) : 0;
    if (b >= 0xC2 && b <= 0xDF && (next & 0xC0) == 0x80) {
      put_utf8(out, fold((static_cast<char32_t>(b & 0x1F) << 6) | (next & 0x3F)));
      ++i;
      continue;
    }
    out += static_cast<char>(b);
  }
}

std::string utf8_fold(std::string_view text) {
  std::string out;
  utf8_fold_append(out, text);
  return out;
}

void charset_to_utf8(std::string_view charset, std::string_view text, std::string& out) {
  std::string key = charset_key(charset);
  if (key.empty() || key == "us-ascii" || key == "ascii" || key == "utf-8" || key == "utf8") {
    out.append(text);
    return;
  }
  static Converters converters;
  iconv_t cd = converters.get(key);
  if (cd == reinterpret_cast<iconv_t>(-1)) {
    out.append(text);
    return;
  }
  iconv(cd, nullptr, nullptr, nullptr, nullptr);  // a fresh start
  char* in = const_cast<char*>(text.data());
  std::size_t in_left = text.size();
  char buf[8192];
  while (in_left > 0) {
    char* o = buf;
    std::size_t o_left = sizeof buf;
    std::size_t r = iconv(cd, &in, &in_left, &o, &o_left);
    int error = errno;
    out.append(buf, static_cast<std::size_t>(o - buf));
    if (r != static_cast<std::size_t>(-1) || error == E2BIG) continue;
    // A byte that does not convert, or a sequence cut off at the end.
    out += kReplacement;
    ++in;
    --in_left;
  }
  char* o = buf;
  std::size_t o_left = sizeof buf;
  iconv(cd, nullptr, nullptr, &o, &o_left);  // a closing shift sequence
  out.append(buf, static_cast<std::size_t>(o - buf));
}

std::string header_words_decode(std::string_view value) {
  std::string out, run_charset, run, blanks;
  auto flush_run = [&] {
    if (run.empty()) return;
    charset_to_utf8(run_charset, run, out);
    run.clear();
  };
  for (std::size_t i = 0; i < value.size();) {
    // An encoded word: "=?" charset "?" B or Q "?" text "?=".
    if (value.compare(i, 2, "=?") == 0) {
      std::size_t q1 = value.find('?', i + 2);
      std::size_t q2 = q1 == std::string_view::npos ? q1 : value.find('?', q1 + 1);
      std::size_t end = q2 == std::string_view::npos ? q2 : value.find("?=", q2 + 1);
      if (end != std::string_view::npos && q2 == q1 + 2 && q1 - i - 2 <= kCharsetName) {
        std::string_view charset = value.substr(i + 2, q1 - i - 2);
        std::string_view text = value.substr(q2 + 1, end - q2 - 1);
        char form = value[q1 + 1];
        bool clean = text.find_first_of(" \t\r\n") == std::string_view::npos;
        if (clean && !charset.empty() && (form == 'B' || form == 'b' || form == 'Q' || form == 'q')) {
          if (charset != run_charset) flush_run();
          run_charset = std::string(charset);
          if (form == 'B' || form == 'b') {
            TransferDecoder(TransferDecoder::Kind::base64).feed(text, run);
          } else {
            for (std::size_t k = 0; k < text.size(); ++k) {
              int hi = k + 2 < text.size() && text[k] == '=' ? hex_digit(text[k + 1]) : -1;
              int lo = hi >= 0 ? hex_digit(text[k + 2]) : -1;
              if (lo >= 0) {
                run += static_cast<char>(hi * 16 + lo);
                k += 2;
              } else {
                run += text[k] == '_' ? ' ' : text[k];
              }
            }
          }
          blanks.clear();  // blanks between two encoded words are no part of the text
          i = end + 2;
          continue;
        }
      }
    }
    char c = value[i++];
    if (!run.empty() && (c == ' ' || c == '\t' || c == '\r' || c == '\n')) {
      blanks += c;
      continue;
    }
    flush_run();
    out += blanks;
    blanks.clear();
    out += c;
  }
  flush_run();
  return out + blanks;
}

TransferDecoder::Kind transfer_kind(std::string_view value) {
  value = trim_blanks(value);
  if (str_iequals(value, "base64")) return TransferDecoder::Kind::base64;
  if (str_iequals(value, "quoted-printable")) return TransferDecoder::Kind::quoted_printable;
  return TransferDecoder::Kind::identity;
}

void TransferDecoder::feed(std::string_view in, std::string& out) {
  switch (kind_) {
    case Kind::identity:
      out.append(in);
      return;
    case Kind::base64:
      for (char c : in) {
        if (c == '=') {  // padding ends a block; another may follow
          bits_ = 0;
          bit_count_ = 0;
          continue;
        }
        int v = base64_digit(c);
        if (v < 0) continue;
        bits_ = (bits_ << 6) | static_cast<unsigned>(v);
        bit_count_ += 6;
        if (bit_count_ >= 8) {
          bit_count_ -= 8;
          out += static_cast<char>((bits_ >> bit_count_) & 0xFF);
          bits_ &= (1u << bit_count_) - 1;
        }
      }
      return;
    case Kind::quoted_printable:
      break;
  }
  std::string joined;
  if (!pending_.empty()) {
    joined = std::exchange(pending_, {});
    joined.append(in);
    in = joined;
  }
  for (std::size_t i = 0; i < in.size(); ++i) {
    if (in[i] != '=') {
      out += in[i];
      continue;
    }
    std::size_t left = in.size() - i - 1;
    if (left >= 1 && in[i + 1] == '\n') {  // a soft line break
      ++i;
      continue;
    }
    if (left >= 1 && in[i + 1] == '\r' && (left == 1 || in[i + 2] == '\n')) {
      if (left == 1) {
        pending_ = "=\r";
        return;
      }
      i += 2;
      continue;
    }
    if (left < 2) {
      pending_ = std::string(in.substr(i));
      return;
    }
    int hi = hex_digit(in[i + 1]), lo = hex_digit(in[i + 2]);
    if (hi < 0 || lo < 0) {
      out += '=';  // not an escape: kept as it is
      continue;
    }
    out += static_cast<char>(hi * 16 + lo);
    i += 2;
  }
}

void TransferDecoder::finish(std::string& out) {
  if (!pending_.starts_with("=\r")) out += pending_;  // (a soft break cut short adds nothing)
  pending_.clear();
}

}  // namespace velmor
