#include "dialler/dialin.h"

#include <algorithm>
#include <cstdlib>

#include "core/config.h"
#include "core/textfile.h"

namespace velmor {

namespace {

constexpr std::size_t kLineMax = 300;
constexpr std::size_t kFieldMax = 250;

std::vector<DialinEntry> entries;

long number(std::string_view field) { return std::strtol(std::string(field).c_str(), nullptr, 10); }

}  // namespace

std::vector<DialinEntry> dialin_parse(std::string_view text) {
  std::vector<DialinEntry> out;
  for_each_line(text, [&](std::string_view line) {
    line = line.substr(0, kLineMax);
    std::vector<std::string_view> fields;
    for (std::size_t i = 0; i < line.size();) {
      while (i < line.size() && (line[i] == ' ' || line[i] == '\t')) ++i;
      std::size_t start = i;
      while (i < line.size() && line[i] != ' ' && line[i] != '\t') ++i;
      if (i > start) fields.push_back(line.substr(start, std::min(i - start, kFieldMax)));
    }
    if (fields.empty()) return;
    fields.resize(11);
    DialinEntry e;
    e.driver = fields[0];
    e.port = number(fields[1]);
    e.answer = fields[2];
    e.init = fields[3];
    e.local = fields[4];
    e.remote = fields[5];
    e.rings = number(fields[6]);
    e.timeout = number(fields[7]);
    e.speed = number(fields[8]);
    e.extra = number(fields[9]);
    e.script = fields[10];
    out.push_back(std::move(e));
  });
  std::reverse(out.begin(), out.end());
  return out;
}

void dialin_load() {
  entries.clear();
  if (text_of(config.dialin_file).empty()) return;
  if (auto text = read_text_file(text_of(config.dialin_file))) entries = dialin_parse(*text);
}

const std::vector<DialinEntry>& dialin_entries() { return entries; }

}  // namespace velmor
