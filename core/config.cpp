// Reading, querying and writing back the master configuration.
//
// The master file is read line by line with no length limit: a "%key:" line
// starts a key, and every following line that is not a comment is a
// continuation whose text is joined to the value with a ",". So a list may be
// written one item per line.
#include "core/config.h"

#include <arpa/inet.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdio>
#include <fstream>
#include <iterator>
#include <unordered_map>

#include "core/filecache.h"
#include "core/globals.h"
#include "core/strfmt.h"
#include "core/util.h"

namespace velmor {

namespace {

bool is_blank(char c) { return c == ' ' || c == '\t'; }

std::string_view skip_blanks(std::string_view s) {
  std::size_t i = 0;
  while (i < s.size() && is_blank(s[i])) ++i;
  return s.substr(i);
}

// atoi without its undefined behaviour on overflow: leading white space, a
// sign and the digits that follow; anything else ends the number. The result
// saturates at the limits of a 32-bit integer.
std::int64_t leading_number(std::string_view s) {
  std::size_t i = 0;
  while (i < s.size() && (is_blank(s[i]) || s[i] == '\n' || s[i] == '\r' || s[i] == '\v' || s[i] == '\f')) ++i;
  bool negative = false;
  if (i < s.size() && (s[i] == '+' || s[i] == '-')) negative = s[i++] == '-';
  std::int64_t n = 0;
  for (; i < s.size() && s[i] >= '0' && s[i] <= '9'; ++i) {
    n = n * 10 + (s[i] - '0');
    if (n > INT32_MAX) n = std::int64_t{INT32_MAX} + 1;
  }
  n = negative ? -n : n;
  return std::clamp<std::int64_t>(n, INT32_MIN, INT32_MAX);
}

const ConfigKeyInfo* find_key(std::string_view key) {
  static const std::unordered_map<std::string, const ConfigKeyInfo*> index = [] {
    std::unordered_map<std::string, const ConfigKeyInfo*> m;
    for (const auto& k : config_keys()) m.emplace(str_lower(k.name), &k);
    return m;
  }();
  auto it = index.find(str_lower(key));
  return it == index.end() ? nullptr : it->second;
}

bool parse_boolean(std::string_view value) {
  // Trailing blanks are not part of the word ("no " is still no).
  while (!value.empty() && is_blank(value.back())) value.remove_suffix(1);
  return !(str_iequals(value, "0") || str_iequals(value, "no") || str_iequals(value, "false") ||
           str_iequals(value, "off"));
}

std::int32_t parse_time_of_day(std::string_view value) {
  std::int64_t hour = leading_number(value);
  std::int64_t minute = 0;
  for (char sep : {':', ',', ';', ' '}) {
    auto at = value.find(sep);
    if (at != std::string_view::npos) {
      minute = leading_number(value.substr(at + 1));
      break;
    }
  }
  return time_of_day(static_cast<int>(hour & 0xff), static_cast<int>(minute & 0xff));
}

std::optional<std::uint32_t> parse_dotted(std::string_view text) {
  if (text.empty() || text.size() > 15) return std::nullopt;
  std::string s(text);
  in_addr a{};
  if (inet_pton(AF_INET, s.c_str(), &a) != 1) return std::nullopt;
  return a.s_addr;
}

std::uint32_t prefix_mask(int bits) {
  return htonl(bits == 0 ? 0u : ~std::uint32_t{0} << (32 - bits));
}

// One item of an address list (the text up to the next ","), or nothing when
// its address does not parse.
std::optional<AddressEntry> parse_address_item(std::string_view item) {
  item = skip_blanks(item);
  std::size_t word_end = 0;
  while (word_end < item.size() && !is_blank(item[word_end]) && item[word_end] != '/' &&
         item[word_end] != '\r' && item[word_end] != '\n')
    ++word_end;
  std::string_view word = item.substr(0, word_end);
  if (str_iequals(word, "all") || word == "*") return AddressEntry{0, 0};
  if (str_iequals(word, "none")) return AddressEntry{0, 0xffffffffu};
  auto address = parse_dotted(word);
  if (!address) return std::nullopt;
  AddressEntry entry{*address, 0xffffffffu};
  std::string_view rest = item.substr(word_end);
  if (!rest.empty() && rest[0] == '/') {
    // The whole prefix is read: /12 is twelve bits. Anything that is not a
    // prefix of 0 to 32 leaves the single host.
    std::string_view digits = rest.substr(1);
    std::size_t n = 0;
    int bits = 0;
    while (n < digits.size() && n < 3 && digits[n] >= '0' && digits[n] <= '9') bits = bits * 10 + (digits[n++] - '0');
    if (n > 0 && bits <= 32) entry.mask = prefix_mask(bits);
  } else {
    rest = skip_blanks(rest);
    std::size_t mask_end = 0;
    while (mask_end < rest.size() && ((rest[mask_end] >= '0' && rest[mask_end] <= '9') || rest[mask_end] == '.'))
      ++mask_end;
    if (mask_end > 0) {
      if (auto mask = parse_dotted(rest.substr(0, mask_end))) entry.mask = *mask;
    }
  }
  return entry;
}

std::string dotted_address(std::uint32_t address_nbo) {
  in_addr a{};
  a.s_addr = address_nbo;
  char text[INET_ADDRSTRLEN] = {};
  return inet_ntop(AF_INET, &a, text, sizeof text) ? text : "";
}

std::string integer_text(const ConfigKeyInfo& k) {
  return strprintf("%d", *static_cast<std::int32_t*>(k.value) / k.multiplier);
}

// Takes the next line (up to LF) off the front of `text`.
std::string_view next_line(std::string_view& text) {
  std::string_view line = text.substr(0, text.find('\n'));
  text.remove_prefix(std::min(line.size() + 1, text.size()));
  return line;
}

// Applies one key of the master file; unknown keys are ignored.
void apply_key(std::string_view key, std::string_view value) {
  if (!key.empty()) config_key(key, value);
}

}  // namespace

AddressList address_list_parse(std::string_view value) {
  AddressList list;
  while (!value.empty()) {
    auto comma = value.find(',');
    std::string_view item = value.substr(0, comma);
    if (auto entry = parse_address_item(item)) list.push_back(*entry);
    if (comma == std::string_view::npos) break;
    value.remove_prefix(comma + 1);
  }
  return list;
}

std::string address_list_text(const AddressList& list) {
  std::string out;
  for (const auto& e : list) {
    if (!out.empty()) out += ", ";
    if (e.address == 0 && e.mask == 0) {
      out += "all";
    } else if (e.address == 0 && e.mask == 0xffffffffu) {
      out += "none";
    } else {
      out += dotted_address(e.address);
      std::uint32_t mask = ntohl(e.mask);
      switch (mask) {
        case 0: out += "/0"; break;
        case 0xff000000u: out += "/8"; break;
        case 0xffff0000u: out += "/16"; break;
        case 0xffffff00u: out += "/24"; break;
        case 0xffffffffu: out += "/32"; break;
        default: out += " " + dotted_address(e.mask); break;
      }
    }
  }
  return out;
}

bool address_list_match(const AddressList& list, std::uint32_t address_nbo) {
  return std::any_of(list.begin(), list.end(), [&](const AddressEntry& e) {
    return (e.address & e.mask) == (address_nbo & e.mask);
  });
}

int yes_no_word(std::string_view text) {
  std::size_t i = 0;
  while (i < text.size() && (is_blank(text[i]) || text[i] == '\r' || text[i] == '\n')) ++i;
  text.remove_prefix(i);
  if (text.empty()) return 1;
  if (text[0] == 'n' || text[0] == 'N') return 0;
  if ((text[0] == 'o' || text[0] == 'O') && text.size() > 1 && (text[1] == 'f' || text[1] == 'F')) return 0;
  return 1;
}

int socket_buffer_size() { return std::max(config.sock_buffer, 1024); }

std::string primary_mail_domain() {
  std::string_view d = text_of(config.mail_domains);
  d.remove_prefix(std::min(d.find_first_not_of(" \t,"), d.size()));
  d = d.substr(0, d.find_first_of(" \t,\r\n"));
  if (d.empty()) return text_of(config.server_name);
  return std::string(d.substr(0, 120));
}

std::string admin_address() {
  std::string address = text_of(config.admin_email);
  if (address.empty() || address.find('@') != std::string::npos) return address;
  std::string domain = primary_mail_domain();
  if (!domain.empty()) address += "@" + domain;
  return address;
}

void config_reset() { config = Config{}; }

int config_key(std::string_view key, std::string_view value) {
  const ConfigKeyInfo* k = find_key(key);
  if (!k) return 0;
  value = skip_blanks(value);
  switch (k->kind) {
    case ConfigKind::integer: {
      std::int64_t n = leading_number(value) * k->multiplier;
      *static_cast<std::int32_t*>(k->value) = static_cast<std::int32_t>(std::clamp<std::int64_t>(n, INT32_MIN, INT32_MAX));
      break;
    }
    case ConfigKind::string:
      *static_cast<ConfigText*>(k->value) = std::string(value);
      break;
    case ConfigKind::boolean:
      *static_cast<bool*>(k->value) = parse_boolean(value);
      break;
    case ConfigKind::time_of_day:
      *static_cast<std::int32_t*>(k->value) = parse_time_of_day(value);
      break;
    case ConfigKind::address_list:
      *static_cast<AddressList*>(k->value) = address_list_parse(value);
      break;
  }
  return 0;
}

std::optional<std::string> config_key(std::string_view key) {
  const ConfigKeyInfo* k = find_key(key);
  if (!k) return std::nullopt;
  switch (k->kind) {
    case ConfigKind::integer:
      return integer_text(*k);
    case ConfigKind::string:
      return *static_cast<ConfigText*>(k->value);
    case ConfigKind::boolean:
      return std::string(*static_cast<bool*>(k->value) ? "yes" : "no");
    case ConfigKind::time_of_day: {
      std::int32_t t = *static_cast<std::int32_t*>(k->value);
      return strprintf("%2d:%2d", (t >> 8) & 0xff, t & 0xff);
    }
    case ConfigKind::address_list:
      return address_list_text(*static_cast<AddressList*>(k->value));
  }
  return std::nullopt;
}

int config_load() { return config_load_file(paths.master()); }

int config_load_file(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  if (!in) {
    std::printf("Couldn't open config file:%s\n", path.c_str());
    std::fflush(stdout);
    return 1;
  }
  config_parse(std::string(std::istreambuf_iterator<char>(in), {}));
  return 0;
}

void config_parse(std::string_view text) {
  std::string key;
  std::string value;
  bool in_key = false;
  while (!text.empty()) {
    std::string_view line = next_line(text);
    if (line.empty() || line[0] == '|' || line[0] == '\r') continue;
    while (!line.empty() && line.back() == '\r') line.remove_suffix(1);
    std::string_view rest = line;
    if (rest[0] == '%') {
      if (in_key) apply_key(key, value);
      rest.remove_prefix(1);
      auto colon = rest.find(':');
      key = std::string(rest.substr(0, colon));
      rest = colon == std::string_view::npos ? std::string_view{} : rest.substr(colon + 1);
      value.clear();
      in_key = true;
    }
    rest = skip_blanks(rest);
    if (!value.empty() && !rest.empty()) value += ',';
    value += rest;
  }
  if (in_key) apply_key(key, value);
}

int config_save() { return config_save_files(paths.master_template(), paths.master()); }

int config_save_files(const std::string& template_path, const std::string& master_path) {
  std::ifstream in(template_path, std::ios::binary);
  if (!in) return ENOENT;
  std::string template_text(std::istreambuf_iterator<char>(in), {});
  if (in.bad()) return EIO;
  return file_write_atomic(master_path, config_text(template_text), /*backup=*/true, 0640);
}

std::string config_text(std::string_view template_text) {
  std::string out;
  while (!template_text.empty()) {
    std::string_view line = next_line(template_text);
    if (line.empty()) continue;
    if (line[0] == '|') {
      out += line;
      out += '\n';
      continue;
    }
    if (line[0] != '%') continue;
    std::string_view name(line);
    name.remove_prefix(1);
    name = name.substr(0, name.find(':'));
    while (!name.empty() && (name.back() == '\r' || is_blank(name.back()))) name.remove_suffix(1);
    const ConfigKeyInfo* k = find_key(name);
    std::optional<std::string> v = k ? config_key(name) : std::nullopt;
    if (!v) {
      out += line;
      out += '\n';
      continue;
    }
    out += '%';
    out += k->name;
    out += ": ";
    if (k->kind == ConfigKind::address_list) {
      // One list item per continuation line.
      std::string_view items = *v;
      for (std::size_t at; (at = items.find(", ")) != std::string_view::npos;) {
        out += items.substr(0, at);
        out += "\n\t";
        items.remove_prefix(at + 2);
      }
      out += items;
    } else {
      out += *v;
    }
    out += '\n';
  }
  return out;
}

}  // namespace velmor
