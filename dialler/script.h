// The dialler's script language and the modem's replies, as pure functions so
// that they can be tested and fuzzed without a serial port.
//
// A script is a text file with one command per line: the line's first
// character (folded to lower case) is the command, the rest of that word is
// skipped, then blanks and tabs; the remainder of the line is the argument.
//   c  run a shell command          d  dial (the argument may be quoted)
//   i  initialise, wait for OK      m  reset the serial port
//   p  pause for N seconds          s  send a line to the modem
//   w  wait for a text from the modem
// Lines that begin with anything else are skipped.
#pragma once

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>

namespace velmor {

// Modem arguments (d, i, s, w) are cut to this many characters; a shell
// command may be this long once its values are put in.
inline constexpr std::size_t kModemArgumentMax = 120;
inline constexpr std::size_t kShellCommandMax = 250;

struct ScriptLine {
  char command = 0;           // 'c', 'd', 'i', 'm', 'p', 's', 'w'; 0 for a skipped line
  std::string_view argument;  // as written (quotes of d taken off), cut to its limit
  std::size_t length = 0;     // bytes of the line with its CR and LF run; 0 at the end
};

// The line that starts `text` (the script from the current position on).
// length 0 means the script has no more text.
ScriptLine script_line(std::string_view text);

// The pause of a p command: the decimal number at the start of the argument,
// kept within a day; 0 when there is none.
long script_seconds(std::string_view argument);

// The values a script may name: %user, %pass, %port, %idle (shell commands
// only), %driver, %phone, %init.
struct ScriptValues {
  std::string user, pass, driver, phone, init;
  long port = 0, idle = 0;
};
ScriptValues script_values_from_config();

enum class Substitute { shell, modem };
struct Substituted {
  std::string text;
  // The first named value (e.g. "%pass") that holds anything but letters,
  // digits, blanks and @ . _ + - : / , = ; empty when every value is plain.
  std::string unsafe;
};
// Puts the named values in: "%name" (any case) becomes its value, "%%" one
// "%", and any other "%" is dropped. Modem text does not know %idle.
Substituted script_substitute(std::string_view text, Substitute mode, const ScriptValues& values);

// What the modem sends, taken apart into lines. A modem ends its replies
// with CR LF and may echo the command first ("ATZ\r\r\nOK\r\n"); one read may
// hold several lines or part of one. A prompt ("login: ") has no line end, so
// the unfinished tail stays visible to whoever waits for a text.
class ModemReplies {
 public:
  static constexpr std::size_t kMax = 4092;  // the oldest bytes go beyond this

  void add(std::string_view bytes);
  // The next complete, non-empty line without its CR and LF; it is consumed.
  std::optional<std::string> next_line();
  // The bytes after the last line end.
  std::string_view unfinished() const;
  // Consumes the first `n` bytes of the unfinished tail.
  void consume_unfinished(std::size_t n);
  void clear() { buffer_.clear(); }
  bool empty() const { return buffer_.empty(); }

 private:
  std::string buffer_;
};

// Result words of a dial, searched for in one line in this order.
enum class DialResult { none, connect, busy, no_carrier, no_dial_tone };
// `connect_text` gets what follows "CONNECT" on the line (blanks skipped, at
// most 100 characters).
DialResult dial_result(std::string_view line, std::string* connect_text);
// The line reads "OK", ignoring case and surrounding blanks.
bool reply_is_ok(std::string_view line);

// The one-line description of the dialler for the status pages.
std::string dialler_status_line(int state, std::string_view connect_text, bool link_is_up,
                                std::string_view awaited, int retries_left);

}  // namespace velmor
