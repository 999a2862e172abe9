#include "http/url.h"

#include <arpa/inet.h>

#include <algorithm>

#include "core/strfmt.h"
#include "core/util.h"
#include "http/chars.h"

namespace velmor::http {

namespace {

bool is_unreserved(char c) { return is_alpha(c) || is_digit(c) || c == '-' || c == '.' || c == '_' || c == '~'; }
bool is_sub_delim(char c) { return std::string_view("!$&'()*+,;=").find(c) != std::string_view::npos; }

// Unreserved characters, sub-delims, `extra` and well-formed "%xx" escapes.
bool only(std::string_view s, std::string_view extra) {
  for (std::size_t i = 0; i < s.size(); ++i) {
    char c = s[i];
    if (c == '%') {
      if (i + 2 >= s.size() || hex_digit(s[i + 1]) < 0 || hex_digit(s[i + 2]) < 0) return false;
      i += 2;
    } else if (!is_unreserved(c) && !is_sub_delim(c) && extra.find(c) == std::string_view::npos) {
      return false;
    }
  }
  return true;
}

bool visible(std::string_view s) {
  return std::none_of(s.begin(), s.end(), [](char c) { return c == ' ' || is_control(c); });
}

// Longer than any name the resolver can look up.
constexpr std::size_t kMaxHost = 255;

bool read_authority(std::string_view text, Url& url) {
  url.has_authority = true;
  std::size_t at = text.find('@');
  if (at != std::string_view::npos) {
    url.has_userinfo = true;
    url.userinfo = std::string(text.substr(0, at));
    if (!only(url.userinfo, ":")) return false;
    text.remove_prefix(at + 1);
  }
  std::size_t host_end = 0;
  if (!text.empty() && text[0] == '[') {
    std::size_t close = text.find(']');
    if (close == std::string_view::npos) return false;
    url.host = str_lower(text.substr(1, close - 1));
    in6_addr address{};
    if (inet_pton(AF_INET6, url.host.c_str(), &address) != 1) return false;
    host_end = close + 1;
  } else {
    host_end = std::min(text.find(':'), text.size());
    url.host = str_lower(text.substr(0, host_end));
    if (url.host.size() > kMaxHost || !only(url.host, "")) return false;
  }
  std::string_view port = text.substr(host_end);
  if (port.empty()) return true;
  if (port[0] != ':') return false;
  port.remove_prefix(1);
  if (port.empty()) return true;  // "host:" names no port
  url.port = port_number(port);
  return url.port != 0;
}

constexpr std::pair<std::string_view, int> kDefaultPorts[] = {
    {"http", 80}, {"https", 443}, {"ftp", 21}, {"gopher", 70}};

}  // namespace

// ---- the parts -----------------------------------------------------------------

std::string Url::user() const {
  std::string user = userinfo.substr(0, userinfo.find(':'));
  url_decode(user, false);
  return user;
}

std::optional<std::string> Url::password() const {
  std::size_t colon = userinfo.find(':');
  if (colon == std::string::npos) return std::nullopt;
  std::string password = userinfo.substr(colon + 1);
  url_decode(password, false);
  return password;
}

int Url::effective_port() const {
  if (port) return port;
  for (const auto& [name, number] : kDefaultPorts) {
    if (scheme == name) return number;
  }
  return 0;
}

std::string Url::host_port() const {
  std::string out = host.find(':') != std::string::npos ? "[" + host + "]" : host;
  if (port) out += ":" + std::to_string(port);
  return out;
}

std::string Url::target() const {
  std::string out = path.empty() ? "/" : path;
  if (has_query) out += "?" + query;
  return out;
}

std::string Url::text() const {
  std::string out;
  if (!scheme.empty()) out += scheme + ":";
  if (has_authority) {
    out += "//";
    if (has_userinfo) out += userinfo + "@";
    out += host_port();
  } else if (path.starts_with("//")) {
    out += "/.";  // else the path's first segment would read as a host
  }
  out += path;
  if (has_query) out += "?" + query;
  if (has_fragment) out += "#" + fragment;
  return out;
}

// ---- parsing --------------------------------------------------------------------

std::optional<Url> parse_url(std::string_view text) {
  if (!visible(text)) return std::nullopt;
  Url url;
  std::size_t colon = text.find(':');
  if (colon != std::string_view::npos && colon < text.find_first_of("/?#")) {
    std::string_view scheme = text.substr(0, colon);
    auto scheme_char = [](char c) { return is_alpha(c) || is_digit(c) || c == '+' || c == '-' || c == '.'; };
    if (scheme.empty() || !is_alpha(scheme[0]) || !std::all_of(scheme.begin(), scheme.end(), scheme_char))
      return std::nullopt;
    url.scheme = str_lower(scheme);
    text.remove_prefix(colon + 1);
  }
  if (std::size_t hash = text.find('#'); hash != std::string_view::npos) {
    url.has_fragment = true;
    url.fragment = std::string(text.substr(hash + 1));
    text = text.substr(0, hash);
  }
  if (std::size_t q = text.find('?'); q != std::string_view::npos) {
    url.has_query = true;
    url.query = std::string(text.substr(q + 1));
    text = text.substr(0, q);
  }
  if (text.starts_with("//")) {
    text.remove_prefix(2);
    std::size_t slash = std::min(text.find('/'), text.size());
    if (!read_authority(text.substr(0, slash), url)) return std::nullopt;
    text.remove_prefix(slash);
  }
  url.path = std::string(text);
  return url;
}

std::optional<Url> parse_target(std::string_view target, std::string_view method) {
  if (!visible(target) || target.find('#') != std::string_view::npos) return std::nullopt;
  Url url;
  if (method == "CONNECT") {
    if (target.find_first_of("/?@") != std::string_view::npos || !read_authority(target, url) || url.host.empty() ||
        url.port == 0)
      return std::nullopt;
    return url;
  }
  if (target == "*") {
    if (method != "OPTIONS") return std::nullopt;
    url.path = "*";
    return url;
  }
  if (target.starts_with("/")) {
    // "//x" is a path here, not a host.
    std::size_t q = target.find('?');
    url.path = std::string(target.substr(0, q));
    if (q != std::string_view::npos) {
      url.has_query = true;
      url.query = std::string(target.substr(q + 1));
    }
    return url;
  }
  std::optional<Url> absolute = parse_url(target);
  if (!absolute || absolute->scheme.empty() || absolute->host.empty()) return std::nullopt;
  return absolute;
}

// ---- resolution -----------------------------------------------------------------

std::string remove_dot_segments(std::string_view in) {
  std::string out;
  while (!in.empty()) {
    if (in.starts_with("../")) {
      in.remove_prefix(3);
    } else if (in.starts_with("./")) {
      in.remove_prefix(2);
    } else if (in.starts_with("/./")) {
      in.remove_prefix(2);
    } else if (in == "/.") {
      in = "/";
    } else if (in.starts_with("/../") || in == "/..") {
      in = in.size() == 3 ? std::string_view("/") : in.substr(3);
      std::size_t last = out.rfind('/');
      out.resize(last == std::string::npos ? 0 : last);
    } else if (in == "." || in == "..") {
      in = {};
    } else {
      std::size_t next = in.find('/', in[0] == '/' ? 1 : 0);
      if (next == std::string_view::npos) next = in.size();
      out += in.substr(0, next);
      in.remove_prefix(next);
    }
  }
  return out;
}

Url resolve(const Url& base, const Url& ref) {
  Url t = ref;
  if (!ref.scheme.empty()) {
    t.path = remove_dot_segments(ref.path);
    return t;
  }
  if (ref.has_authority) {
    t.path = remove_dot_segments(ref.path);
  } else {
    if (ref.path.empty()) {
      t.path = base.path;
      if (!ref.has_query) {
        t.has_query = base.has_query;
        t.query = base.query;
      }
    } else if (ref.path[0] == '/') {
      t.path = remove_dot_segments(ref.path);
    } else {
      std::string merged = base.has_authority && base.path.empty()
                               ? "/" + ref.path
                               : base.path.substr(0, base.path.rfind('/') + 1) + ref.path;
      t.path = remove_dot_segments(merged);
    }
    t.has_authority = base.has_authority;
    t.has_userinfo = base.has_userinfo;
    t.userinfo = base.userinfo;
    t.host = base.host;
    t.port = base.port;
  }
  t.scheme = base.scheme;
  return t;
}

// ---- escaping ---------------------------------------------------------------------

DecodeResult url_decode(std::string& text, bool plus_as_blank) {
  DecodeResult result = DecodeResult::ok;
  std::size_t out = 0;
  for (std::size_t i = 0; i < text.size(); ++i) {
    char c = text[i];
    if (c == '+' && plus_as_blank) {
      c = ' ';
    } else if (c == '%') {
      int hi = i + 2 < text.size() ? hex_digit(text[i + 1]) : -1;
      int lo = i + 2 < text.size() ? hex_digit(text[i + 2]) : -1;
      if (hi >= 0 && lo >= 0) {
        c = static_cast<char>(hi * 16 + lo);
        if (c == '\0') result = DecodeResult::nul;
        i += 2;
      } else if (result == DecodeResult::ok) {
        result = DecodeResult::bad_escape;
      }
    }
    text[out++] = c;
  }
  text.resize(out);
  return result;
}

std::string url_escape(std::string_view text) {
  std::string out;
  out.reserve(text.size());
  for (char c : text) {
    if (is_alpha(c) || is_digit(c) || c == '/') {
      out += c;
    } else if (c == ' ') {
      out += '+';
    } else {
      strappendf(out, "%%%02x", static_cast<unsigned char>(c));
    }
  }
  return out;
}

std::string path_escape(std::string_view path) {
  std::string out;
  out.reserve(path.size());
  for (char c : path) {
    if (is_unreserved(c) || is_sub_delim(c) || c == ':' || c == '@' || c == '/') {
      out += c;
    } else {
      strappendf(out, "%%%02X", static_cast<unsigned char>(c));
    }
  }
  return out;
}

}  // namespace velmor::http
