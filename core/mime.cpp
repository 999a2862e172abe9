// The MIME map: one entry per line of the file named by file.mimetypes,
// "type  name  hex-number  extension text", kept in file order. Every lookup
// walks from the head and the first match wins.
#include "core/mime.h"

#include <cstdlib>
#include <vector>

#include "core/config.h"
#include "core/textfile.h"
#include "core/util.h"

namespace velmor {

namespace {

struct MimeMapEntry {
  std::string extensions;  // the rest of the line, e.g. ".html .htm"
  std::string type;
  std::string name;
  int filetype = 0;
};

std::vector<MimeMapEntry> entries;

constexpr std::string_view kDefaultType = "application/octet-stream";
constexpr std::string_view kDefaultName = "data";

bool is_blank(char c) { return c == ' ' || c == '\t'; }

// A column runs to the next blank or tab; false when the line ends first.
bool take_column(std::string_view& line, std::string_view& column) {
  std::size_t end = 0;
  while (end < line.size() && !is_blank(line[end])) ++end;
  if (end == line.size()) return false;
  column = line.substr(0, end);
  line.remove_prefix(end);
  while (!line.empty() && is_blank(line.front())) line.remove_prefix(1);
  return true;
}

void parse_line(std::string_view line) {
  MimeMapEntry e;
  std::string_view type, name, number;
  // A line that ends within the first three columns is malformed and skipped.
  if (!take_column(line, type) || !take_column(line, name)) return;
  std::size_t end = 0;
  while (end < line.size() && !is_blank(line[end])) ++end;
  number = line.substr(0, end);
  line.remove_prefix(end);
  while (!line.empty() && is_blank(line.front())) line.remove_prefix(1);
  e.type = type;
  e.name = name;
  e.filetype = static_cast<int>(std::strtol(std::string(number).c_str(), nullptr, 16));
  e.extensions = line;
  entries.push_back(std::move(e));
}

// Extensions are matched whole, with or without their ".", so that ".h" is
// not taken for ".html".
std::string_view undotted(std::string_view ext) {
  if (!ext.empty() && ext[0] == '.') ext.remove_prefix(1);
  return ext;
}

// Calls `match` on each blank-separated word of the entry's extension text.
template <class Pred>
bool any_extension(const MimeMapEntry& e, Pred match) {
  std::string_view rest = e.extensions;
  while (!rest.empty()) {
    while (!rest.empty() && is_blank(rest.front())) rest.remove_prefix(1);
    std::size_t end = 0;
    while (end < rest.size() && !is_blank(rest[end])) ++end;
    if (end > 0 && match(rest.substr(0, end))) return true;
    rest.remove_prefix(end);
  }
  return false;
}

template <class Pred>
const MimeMapEntry* find(Pred pred) {
  for (const auto& e : entries)
    if (pred(e)) return &e;
  return nullptr;
}

// A name matches an entry when it ends with one of the entry's extensions.
const MimeMapEntry* by_name(std::string_view name) {
  return find([&](const MimeMapEntry& e) {
    return any_extension(e, [&](std::string_view ext) {
      std::string_view word = undotted(ext);
      if (name.size() <= word.size() || name[name.size() - word.size() - 1] != '.') return false;
      return str_iequals(name.substr(name.size() - word.size()), word);
    });
  });
}

const MimeMapEntry* by_filetype(int filetype) {
  return find([&](const MimeMapEntry& e) { return e.filetype == filetype; });
}

}  // namespace

int mime_map_load() {
  mime_map_clear();  // a reload replaces the map
  std::optional<std::string> text = read_text_file(text_of(config.file_mimetypes));
  if (!text) return 1;
  mime_map_parse(*text);
  return 0;
}

void mime_map_parse(std::string_view text) {
  mime_map_clear();
  for_each_line(text, [](std::string_view line) {
    char c = line.empty() ? 0 : line[0];
    if ((c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z')) parse_line(line);
  });
}

void mime_map_clear() { entries.clear(); }

std::string mime_type_for_extension(std::string_view text) {
  std::string_view key = undotted(text);
  auto e = key.empty() ? nullptr : find([&](const MimeMapEntry& m) {
    return any_extension(m, [&](std::string_view ext) { return str_iequals(undotted(ext), key); });
  });
  return std::string(e ? std::string_view(e->type) : kDefaultType);
}

std::string mime_type_for_filetype(int filetype) {
  auto e = by_filetype(filetype);
  return std::string(e ? std::string_view(e->type) : kDefaultType);
}

int filetype_for_mime_type(std::string_view type) {
  auto e = find([&](const MimeMapEntry& m) { return str_iequals(m.type, type); });
  return e ? e->filetype : kFiletypeData;
}

int filetype_for_name(std::string_view name) {
  auto e = by_name(name);
  return e ? e->filetype : kFiletypeData;
}

std::string filetype_name_for_name(std::string_view name) {
  auto e = by_name(name);
  return std::string(e ? std::string_view(e->name) : kDefaultName);
}

std::string filetype_name_for_filetype(int filetype) {
  auto e = by_filetype(filetype);
  return std::string(e ? std::string_view(e->name) : kDefaultName);
}

}  // namespace velmor
