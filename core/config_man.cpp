// Writes the manual page of the master configuration, velmor-master(5),
// from the key table itself (core/config_keys.cpp): every key with its kind,
// its built-in default, what the default installation writes, and what
// reads it. Run by the build, so the page cannot drift from the table.
//
//   velmor_config_man OUTPUT
#include <cstdio>
#include <fstream>
#include <map>
#include <string>
#include <string_view>

#include "core/config.h"
#include "core/defaults.h"
#include "core/globals.h"
#include "core/textfile.h"

namespace {

using namespace velmor;

// Text safe in a troff line.
std::string esc(std::string_view text) {
  std::string out;
  for (char c : text) {
    if (c == '\\') {
      out += "\\e";
    } else if (c == '-') {
      out += "\\-";
    } else {
      out += c;
    }
  }
  if (!out.empty() && (out[0] == '.' || out[0] == '\'')) out.insert(0, "\\&");
  return out;
}

std::string kind_text(const ConfigKeyInfo& k) {
  switch (k.kind) {
    case ConfigKind::integer: return k.multiplier == 1024 ? "integer, in kilobytes" : "integer";
    case ConfigKind::string: return "text";
    case ConfigKind::boolean: return "yes or no";
    case ConfigKind::time_of_day: return "time of day";
    case ConfigKind::address_list: return "address list";
  }
  return "";
}

std::string shown(const std::optional<std::string>& value) {
  if (!value) return "unset";
  std::string_view v = *value;
  while (!v.empty() && v.front() == ' ') v.remove_prefix(1);
  return v.empty() ? "empty" : std::string(v);
}

// Each key's value in the default installation's master file, its
// placeholders put in words.
std::map<std::string, std::string> init_values() {
  std::map<std::string, std::string> out;
  for (const DefaultFile& f : default_files()) {
    if (f.path != "config/templates/master") continue;
    for_each_line(f.data, [&](std::string_view line) {
      if (line.empty() || line[0] != '%') return;
      std::size_t colon = line.find(':');
      if (colon == std::string_view::npos) return;
      std::string key(line.substr(1, colon - 1));
      for (char& c : key) c = static_cast<char>(c >= 'A' && c <= 'Z' ? c - 'A' + 'a' : c);
      std::string value(line.substr(colon + 1));
      value.erase(0, value.find_first_not_of(" \t"));
      static const std::pair<std::string_view, std::string_view> kWords[] = {
          {"@HOSTNAME@", "this host's name"},        {"@SERVER_USER@", "the user given with --user"},
          {"@SMTP_PORT@", "2525 (25 with --standard-ports)"}, {"@POP_PORT@", "1110 (110 with --standard-ports)"},
          {"@IMAP_PORT@", "1143 (143 with --standard-ports)"}, {"@NNTP_PORT@", "1119 (119 with --standard-ports)"},
          {"@WEB_PORT@", "8000 (80 with --standard-ports)"},
          {"@SMTP_ENABLED@", "yes when this build runs the service, else no"},
          {"@POP_ENABLED@", "yes when this build runs the service, else no"},
          {"@IMAP_ENABLED@", "yes when this build runs the service, else no"},
          {"@NNTP_ENABLED@", "yes when this build runs the service, else no"},
          {"@WEB_ENABLED@", "yes when this build runs the service, else no"},
      };
      for (const auto& [from, to] : kWords)
        for (std::size_t at; (at = value.find(from)) != std::string::npos;) value.replace(at, from.size(), to);
      out[key] = value.empty() ? "empty" : value;
    });
  }
  return out;
}

constexpr const char* kHead = R"(.TH VELMOR-MASTER 5 "" "Velmor @VERSION@" "Velmor"
.SH NAME
velmor-master \- the master configuration of the Velmor server suite
.SH SYNOPSIS
.I DIR\fB/config/master\fP
.SH DESCRIPTION
Every setting of the suite is one key of this file.
.I DIR
is the installation folder:
.B /usr/local/velmor
unless
.B velmor \-\-root
names another. The suite reads the file at start-up and again on
.BR "velmorctl reload config" ;
a changed port or enabled switch takes effect at the next start.
.PP
A line
.RI % key :\  value
sets a key; a line that begins with a blank or a tab continues the value of
the key above it (the parts are joined with a comma); a line that begins
with | is a comment. Keys compare without regard to case. Relative paths
are relative to the installation folder. A key missing from the file keeps
its built-in default.
.B velmor \-\-root
.I DIR
.B \-\-init
writes a file that sets every key, with comments; where its value differs
from the built-in default, it is given below.
.PP
Kinds of value:
.TP
.B integer
a decimal number; the two keys in kilobytes are stored multiplied by 1024.
.TP
.B text
the rest of the line after the blanks that follow the colon.
.TP
.B yes or no
0, no, false and off (in any case) are no; anything else, an empty value
included, is yes.
.TP
.B time of day
hour and minute, as 7:05 (a comma, semicolon or blank may stand for the colon).
.TP
.B address list
items separated by commas: all or *, none, an IPv4 address, address/prefix
(0, 8, 16, 24 or 32), or an address, a blank and a dotted mask.
.SH KEYS
)";

constexpr const char* kTail = R"(.SH FILES
.TP
.I DIR/config/master
this file
.TP
.I DIR/config/templates/master
the template from which the administration pages write it back
.SH SEE ALSO
.BR velmor (8),
.BR velmorctl (8)
)";

}  // namespace

int main(int argc, char** argv) {
  if (argc != 2) {
    std::fprintf(stderr, "usage: velmor_config_man OUTPUT\n");
    return 2;
  }
  std::string page = kHead;
  page.replace(page.find("@VERSION@"), 9, kVersion);
  config_reset();
  std::map<std::string, std::string> written = init_values();
  for (const ConfigKeyInfo& k : config_keys()) {
    std::string_view reader = config_key_reader(k.name);
    if (reader.empty()) {
      std::fprintf(stderr, "velmor_config_man: nothing says what reads %s (core/config_keys.cpp)\n", k.name);
      return 1;
    }
    std::string def = shown(config_key(k.name));
    page += ".TP\n.B " + esc(k.name) + "\n";
    std::string text = kind_text(k) + ". Default: " + def + ".";
    auto init = written.find(k.name);
    if (init != written.end() && init->second != def) text += " Written by --init: " + init->second + ".";
    page += esc(text) + "\nRead by: " + esc(reader) + ".\n";
  }
  page += kTail;
  std::ofstream out(argv[1], std::ios::binary | std::ios::trunc);
  out << page;
  out.close();
  if (!out) {
    std::fprintf(stderr, "velmor_config_man: cannot write %s\n", argv[1]);
    return 1;
  }
  return 0;
}
