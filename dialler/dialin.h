// Dial-in entries: one line per modem that could answer calls, read from
// dialin.file at start-up and kept in memory. Nothing answers calls with
// them yet; the administration pages show them.
#pragma once

#include <string>
#include <string_view>
#include <vector>

namespace velmor {

struct DialinEntry {
  std::string driver;
  long port = 0;
  std::string answer, init, local, remote;
  long rings = 0, timeout = 0, speed = 0;
  long extra = 0;  // the tenth field: read as a number and kept
  std::string script;
  bool enabled = true;
};

// The entries of a dial-in file's text, last line first. Fields are
// separated by blanks or tabs and cut at 250 characters; a line is read up to
// 300 characters; blank lines hold no entry.
std::vector<DialinEntry> dialin_parse(std::string_view text);

// Start-up: loads dialin.file (a missing or unset file leaves no entries).
void dialin_load();
const std::vector<DialinEntry>& dialin_entries();

}  // namespace velmor
