#include "dialler/script.h"

#include <algorithm>

#include "core/config.h"
#include "core/strfmt.h"
#include "core/util.h"

namespace velmor {

namespace {

bool is_letter(char c) { return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z'); }
bool is_digit(char c) { return c >= '0' && c <= '9'; }

// The characters a value may hold and still be put into a shell command
// unquoted: nothing the shell would treat as syntax.
bool shell_safe(std::string_view value) {
  return std::all_of(value.begin(), value.end(), [](char c) {
    return is_letter(c) || is_digit(c) || std::string_view(" @._+-:/,=").find(c) != std::string_view::npos;
  });
}

}  // namespace

ScriptLine script_line(std::string_view text) {
  ScriptLine out;
  if (text.empty()) return out;
  std::size_t end = std::min(text.find_first_of("\r\n"), text.size());
  std::string_view line = text.substr(0, end);
  std::size_t next = text.find_first_not_of("\r\n", end);
  out.length = next == std::string_view::npos ? text.size() : next;
  if (line.empty()) return out;

  char command = line[0] >= 'A' && line[0] <= 'Z' ? static_cast<char>(line[0] - 'A' + 'a') : line[0];
  if (std::string_view("cdimpsw").find(command) == std::string_view::npos) return out;
  out.command = command;
  std::size_t i = 1;
  while (i < line.size() && is_letter(line[i])) ++i;
  while (i < line.size() && (line[i] == ' ' || line[i] == '\t')) ++i;
  std::string_view argument = line.substr(i);
  if (command == 'd') {
    if (!argument.empty() && argument[0] == '"') argument.remove_prefix(1);
    argument = argument.substr(0, argument.find('"'));
  }
  // A shell command is measured once its values are in.
  if (command != 'c') argument = argument.substr(0, kModemArgumentMax);
  out.argument = argument;
  return out;
}

long script_seconds(std::string_view argument) {
  long seconds = 0;
  for (char c : argument) {
    if (!is_digit(c)) break;
    seconds = std::min(seconds * 10 + (c - '0'), 86400L);
  }
  return seconds;
}

ScriptValues script_values_from_config() {
  ScriptValues v;
  v.user = text_of(config.dialler_user);
  v.pass = text_of(config.dialler_pass);
  v.driver = text_of(config.dialler_driver);
  v.phone = text_of(config.dialler_phone);
  v.init = text_of(config.dialler_init);
  v.port = config.dialler_port;
  v.idle = config.dialler_timeout;
  return v;
}

Substituted script_substitute(std::string_view text, Substitute mode, const ScriptValues& values) {
  const std::string port = std::to_string(values.port), idle = std::to_string(values.idle);
  const struct {
    std::string_view name;
    const std::string& value;
  } names[] = {{"user", values.user},     {"pass", values.pass},   {"port", port},
               {"idle", idle},            {"driver", values.driver}, {"phone", values.phone},
               {"init", values.init}};
  Substituted out;
  for (std::size_t i = 0; i < text.size();) {
    if (text[i] != '%') {
      out.text += text[i++];
      continue;
    }
    std::string_view after = text.substr(i + 1);
    if (!after.empty() && after[0] == '%') {
      out.text += '%';
      i += 2;
      continue;
    }
    ++i;  // an unknown "%" is dropped
    for (const auto& n : names) {
      if (mode == Substitute::modem && n.name == "idle") continue;
      if (!str_istarts_with(after, n.name)) continue;
      out.text += n.value;
      if (out.unsafe.empty() && !shell_safe(n.value)) out.unsafe = "%" + std::string(n.name);
      i += n.name.size();
      break;
    }
  }
  return out;
}

void ModemReplies::add(std::string_view bytes) {
  buffer_ += bytes;
  if (buffer_.size() > kMax) buffer_.erase(0, buffer_.size() - kMax);
}

std::optional<std::string> ModemReplies::next_line() {
  for (;;) {
    std::size_t end = buffer_.find_first_of("\r\n");
    if (end == std::string::npos) return std::nullopt;
    std::size_t next = std::min(buffer_.find_first_not_of("\r\n", end), buffer_.size());
    std::string line = buffer_.substr(0, end);
    buffer_.erase(0, next);
    if (!line.empty()) return line;
  }
}

std::string_view ModemReplies::unfinished() const {
  std::size_t last = buffer_.find_last_of("\r\n");
  return last == std::string::npos ? std::string_view(buffer_) : std::string_view(buffer_).substr(last + 1);
}

void ModemReplies::consume_unfinished(std::size_t n) {
  std::size_t start = buffer_.size() - unfinished().size();
  buffer_.erase(start, std::min(n, buffer_.size() - start));
}

DialResult dial_result(std::string_view line, std::string* connect_text) {
  if (auto at = str_casestr(line, "CONNECT")) {
    if (connect_text) {
      std::string_view rest = line.substr(*at + 7);
      rest.remove_prefix(std::min(rest.find_first_not_of(" \t"), rest.size()));
      *connect_text = std::string(rest.substr(0, 100));
    }
    return DialResult::connect;
  }
  if (str_casestr(line, "BUSY")) return DialResult::busy;
  if (str_casestr(line, "NO CARRIER")) return DialResult::no_carrier;
  if (str_casestr(line, "NO DIAL TONE")) return DialResult::no_dial_tone;
  return DialResult::none;
}

bool reply_is_ok(std::string_view line) { return str_iequals(trim_blanks(line), "OK"); }

std::string dialler_status_line(int state, std::string_view connect_text, bool link_is_up,
                                std::string_view awaited, int retries_left) {
  switch (state) {
    case 0: return "No network link and dialler is idle";
    case 1:
      return strprintf("Dialler connected [%.*s]: %s", static_cast<int>(connect_text.size()), connect_text.data(),
                       link_is_up ? "Link Good" : "No Link");
    case 5: return "Dialling number";
    case 7: return "Login script waiting for:" + std::string(awaited);
    case 10: return strprintf("Dial failed, retries left:%d", retries_left);
    case 11: return "Login script pausing";
    default: return "Unknown dialler state - worry slightly";
  }
}

}  // namespace velmor
