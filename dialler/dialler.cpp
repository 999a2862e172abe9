// The modem dialler. Everything here runs from the main loop and returns at
// once: the serial descriptor is non-blocking, replies are read as they come,
// shell commands run as reaped children, and the serial-port reset holds DTR
// down across polls instead of sleeping.
#include "dialler/dialler.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/ioctl.h>
#include <termios.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstring>

#include "core/config.h"
#include "core/filecache.h"
#include "core/fileio.h"
#include "core/globals.h"
#include "core/hooks.h"
#include "core/log.h"
#include "core/process.h"
#include "core/strfmt.h"
#include "core/util.h"
#include "dialler/script.h"

namespace velmor {

namespace {

namespace st {
inline constexpr int idle = 0;
inline constexpr int complete = 1;  // on line; the link monitor decides about the link
inline constexpr int script = 2;
inline constexpr int init = 4;
inline constexpr int dialling = 5;
inline constexpr int waiting = 7;
inline constexpr int redial = 10;
inline constexpr int pausing = 11;
}  // namespace st

// The dialler's status-change bits: a script is running, and "the link or
// the dialler changed" for the status displays.
constexpr std::uint32_t kDiallerRunning = 0x8000;
constexpr std::uint32_t kNetworkChanged = 0x80;

// DTR stays down this long at a reset, long enough for any modem to hang up.
constexpr std::int64_t kDtrDownMs = 500;
// Comment lines skipped in one pass before the script yields.
constexpr int kSkipsPerPass = 1000;

struct PortReset {
  bool pending = false;
  int fd = -1;     // the descriptor whose DTR is down
  UniqueFd owned;  // set when the reset holds the descriptor itself
  int bits = 0;
  std::int64_t raise_at = 0;
};

struct Dialler {
  int state = st::idle;
  UniqueFd serial;
  CacheFile script;
  std::uint64_t script_pos = 0;
  ModemReplies replies;
  std::string expect;  // the dial string (states 5, 10) or the awaited text (7)
  std::string connect_text;
  int retries_left = 0;
  std::time_t deadline = 0;
  std::time_t dial_started = 0;
  std::time_t online_since = 0;  // 0 = not on line
  bool watching = false;
  std::time_t watch_since = 0;
  bool lines_note_logged = false;
  bool device_gone = false;  // a read saw the end of the device
  PortReset reset;
};

Dialler& dialler() {
  static Dialler d;
  return d;
}

DiallerSeam seam;

int get_lines(int fd, int* bits) { return seam.get_lines ? seam.get_lines(fd, bits) : ::ioctl(fd, TIOCMGET, bits); }
int set_lines(int fd, int bits) { return seam.set_lines ? seam.set_lines(fd, bits) : ::ioctl(fd, TIOCMSET, &bits); }
std::int64_t clock_ms() {
  if (seam.clock_ms) return seam.clock_ms();
  return std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::steady_clock::now().time_since_epoch())
      .count();
}

void log_dialler(std::string_view text, std::string_view value = {}) { log_message(text, value, logfac::dialler); }

// A pseudo-terminal, or an adapter without the lines: the device cannot say
// whether there is a carrier, so it counts as present while the device reads.
bool lines_unsupported(int error) { return error == ENOTTY || error == EINVAL; }
void note_lines_missing(int error) {
  Dialler& d = dialler();
  if (d.lines_note_logged) return;
  d.lines_note_logged = true;
  log_message("Modem-control lines not available, watching the device for a hang-up instead: ",
              std::strerror(error));
}

UniqueFd open_device() {
  return UniqueFd(
      ::open(text_of(config.dialler_driver).c_str(), O_RDWR | O_NOCTTY | O_NONBLOCK | O_CLOEXEC));
}

// Output still queued would make the close wait for the line to drain it.
void close_port(UniqueFd& fd) {
  if (!fd) return;
  ::tcflush(fd.get(), TCIOFLUSH);
  fd.close();
}

// ---- serial-port reset ------------------------------------------------------

// Raises DTR (and RTS) again and lets go of a descriptor the reset held. At
// shutdown `raise` is false: the port is closed with DTR down.
void finish_reset(bool raise) {
  PortReset& r = dialler().reset;
  if (!r.pending) return;
  r.pending = false;
  if (raise && set_lines(r.fd, r.bits | TIOCM_DTR | TIOCM_RTS) != 0) log_dialler("TIOCMSET (up) fail");
  close_port(r.owned);
  r.fd = -1;
  if (raise) log_dialler("Serial port reset");
}

// Drops DTR, so the modem hangs up and resets; the dialler poll raises it
// again half a second later and the script waits until then.
void reset_serial_port() {
  progress_code = 190500;
  Dialler& d = dialler();
  log_dialler("Resetting serial port");
  finish_reset(true);
  UniqueFd opened;
  int fd = d.serial.get();
  if (fd < 0) {
    log_dialler("Re-opening serial device");
    opened = open_device();
    if (!opened) {
      log_dialler("Re-open failed:", std::strerror(errno));
      return;
    }
    fd = opened.get();
  }
  int bits = 0;
  if (get_lines(fd, &bits) != 0) {
    int error = errno;
    if (lines_unsupported(error))
      note_lines_missing(error);
    else
      log_dialler("TIOCMGET fail");
    close_port(opened);
    return;
  }
  bits &= ~TIOCM_DTR;
  if (set_lines(fd, bits) != 0) {
    log_dialler("TIOCMSET (down) fail");
    close_port(opened);
    return;
  }
  d.reset.pending = true;
  d.reset.fd = fd;
  d.reset.owned = std::move(opened);
  d.reset.bits = bits;
  d.reset.raise_at = clock_ms() + kDtrDownMs;
}

// Closes the dialler's port; a reset still running on it keeps it until DTR
// is up again.
void close_serial() {
  Dialler& d = dialler();
  if (!d.serial) return;
  if (d.reset.pending && d.reset.fd == d.serial.get() && !d.reset.owned)
    d.reset.owned = std::move(d.serial);
  else
    close_port(d.serial);
}

// ---- the modem --------------------------------------------------------------

bool carrier_present() {
  Dialler& d = dialler();
  if (!d.serial || d.device_gone) return false;
  int bits = 0;
  if (get_lines(d.serial.get(), &bits) == 0) return (bits & TIOCM_CAR) != 0;
  int error = errno;
  if (!lines_unsupported(error)) return false;
  note_lines_missing(error);
  // Asking for no events still reports a hang-up, and takes no bytes from
  // whoever reads the line now (the link's own program).
  pollfd p{d.serial.get(), 0, 0};
  return ::poll(&p, 1, 0) <= 0 || (p.revents & (POLLHUP | POLLERR | POLLNVAL)) == 0;
}

enum class ReadResult { nothing, data, hung_up };

// Takes what the modem has sent into the reply buffer. An end of file or EIO
// is the device going away: carrier loss.
ReadResult read_modem() {
  progress_code = 190300;
  Dialler& d = dialler();
  if (!d.serial) {
    log_dialler("recv: no tty open");
    return ReadResult::nothing;
  }
  ReadResult result = ReadResult::nothing;
  char buf[512];
  for (int reads = 0; reads < 16; ++reads) {
    ssize_t n = ::read(d.serial.get(), buf, sizeof buf);
    if (n > 0) {
      d.replies.add(std::string_view(buf, static_cast<std::size_t>(n)));
      result = ReadResult::data;
    } else if (n == 0 || errno == EIO) {
      d.device_gone = true;
      return ReadResult::hung_up;
    } else if (errno != EINTR) {
      break;
    }
  }
  return result;
}

// Writes a line of the script to the modem with its values put in, then CR.
// Logs only ever show the line as written.
void write_modem(std::string_view text) {
  progress_code = 190400;
  Dialler& d = dialler();
  d.replies.clear();
  if (!d.serial) return;
  std::string out = script_substitute(text, Substitute::modem, script_values_from_config()).text + "\r";
  std::string_view rest = out;
  while (!rest.empty()) {
    ssize_t n = ::write(d.serial.get(), rest.data(), rest.size());
    if (n > 0) {
      rest.remove_prefix(static_cast<std::size_t>(n));
    } else if (n < 0 && errno == EINTR) {
      continue;
    } else {
      log_dialler("Modem write failed:", std::strerror(n < 0 ? errno : EIO));
      return;
    }
  }
}

// The next complete reply line, logged as it is taken.
std::optional<std::string> next_reply() {
  auto line = dialler().replies.next_line();
  if (line) log_dialler("< ", *line);
  return line;
}

void carrier_lost() {
  log_message("Modem has hung up - dialler going idle.");
  disconnect();
}

// ---- the script -------------------------------------------------------------

void script_complete() {
  Dialler& d = dialler();
  log_message("Dialler - script complete");
  log_write("Dialler - script complete", logchan::dialler);
  log_dialler("Script complete");
  d.state = st::complete;
  link_up = 0;
  if (hooks.link_probe_restart) hooks.link_probe_restart();
  if (d.script) filecache_close(d.script);
}

// The administration pages can set every value a command names, so a value
// is only put into a shell command when it holds nothing the shell would read
// as syntax; a command cut short could run something else, so it is not run
// either.
void shell_command(std::string_view written) {
  Substituted command = script_substitute(written, Substitute::shell, script_values_from_config());
  if (!command.unsafe.empty()) {
    log_message("Refusing shell command: unsafe value in ", command.unsafe);
    return;
  }
  if (command.text.size() > kShellCommandMax) {
    log_message("Refusing shell command: longer than 250 characters");
    return;
  }
  log_dialler("Executing string: ", written);
  if (run_shell(command.text + " &") < 0) log_message("Could not start shell command: ", written);
}

void run_command(char command, const std::string& argument) {
  Dialler& d = dialler();
  switch (command) {
    case 'c':
      shell_command(argument);
      break;
    case 'd':
      d.expect = argument;
      d.retries_left = config.dialler_retries;
      d.deadline = server_now + config.dialler_retrytime;
      d.state = st::dialling;
      d.online_since = 0;
      log_dialler("Dialling:", argument);
      write_modem(argument);
      d.dial_started = server_now;
      break;
    case 'i':
      log_dialler("Modem init:", argument);
      write_modem(argument);
      d.state = st::init;
      break;
    case 'm':
      reset_serial_port();
      break;
    case 'p':
      d.deadline = server_now + script_seconds(argument);
      d.state = st::pausing;
      log_dialler("Pausing");
      break;
    case 's':
      write_modem(argument);
      break;
    case 'w':
      d.expect = argument;
      d.state = st::waiting;
      log_dialler("Waiting for:", argument);
      break;
  }
}

// Runs the next command of the script; the end of the script hands the link
// to the link monitor.
void script_step() {
  progress_code = 190200;
  Dialler& d = dialler();
  for (int skipped = 0; skipped < kSkipsPerPass; ++skipped) {
    ScriptLine line = script_line(d.script ? filecache_view(d.script, d.script_pos) : std::string_view());
    if (line.length == 0) {
      script_complete();
      return;
    }
    d.script_pos += line.length;
    if (line.command) {
      // The view lasts only until the next call on the cache.
      run_command(line.command, std::string(line.argument));
      return;
    }
  }
}

// ---- waiting for the modem --------------------------------------------------

void await_ok() {
  if (read_modem() == ReadResult::hung_up) return carrier_lost();
  while (auto line = next_reply()) {
    if (reply_is_ok(*line)) {
      dialler().state = st::script;
      return;
    }
  }
}

void await_dial_result() {
  Dialler& d = dialler();
  if (server_now - d.dial_started > config.dialler_dialtime) {
    // A time-out does not use up a retry.
    log_message("Dialler - Timed out trying to dial. Retries left: ", std::to_string(d.retries_left));
    d.state = st::redial;
    d.replies.clear();
    d.deadline = server_now + config.dialler_retrytime;
    return;
  }
  if (read_modem() == ReadResult::hung_up) return carrier_lost();
  while (auto line = next_reply()) {
    std::string connect_text;
    DialResult result = dial_result(*line, &connect_text);
    if (result == DialResult::none) continue;
    if (result == DialResult::connect) {
      // What follows the CONNECT line (a login prompt) stays for the script.
      d.online_since = server_now;
      d.connect_text = connect_text;
      d.state = st::script;
      link_watch();
      return;
    }
    const char* what = result == DialResult::busy         ? "line busy"
                       : result == DialResult::no_carrier ? "no carrier"
                                                          : "no dial tone";
    if (--d.retries_left >= 0) {
      log_message(strprintf("Dialler - modem reported %s. Retries left: ", what), std::to_string(d.retries_left));
      d.state = st::redial;
      d.replies.clear();
      d.deadline = server_now + config.dialler_retrytime;
      if (result != DialResult::busy) reset_serial_port();
    } else {
      log_message(strprintf("Dialler - modem reported %s, going idle", what));
      disconnect();
    }
    return;
  }
}

void found_text() {
  log_dialler("Found string");
  dialler().state = st::script;
}

// A prompt such as "login: " comes without a line end, so the unfinished
// line is searched too.
void await_text() {
  Dialler& d = dialler();
  if (read_modem() == ReadResult::hung_up) return carrier_lost();
  while (auto line = next_reply()) {
    log_dialler("Checking: ", *line);
    if (str_casestr(*line, d.expect)) return found_text();
  }
  std::string_view tail = d.replies.unfinished();
  if (d.expect.empty() || tail.empty()) return;
  if (auto at = str_casestr(tail, d.expect)) {
    log_dialler("Checking: ", tail);
    d.replies.consume_unfinished(*at + d.expect.size());
    found_text();
  }
}

}  // namespace

// ---- interface --------------------------------------------------------------

void dial() {
  progress_code = 190000;
  Dialler& d = dialler();
  if (d.state != st::idle) return;
  close_serial();
  d.lines_note_logged = false;
  d.device_gone = false;
  d.replies.clear();
  d.serial = open_device();
  if (!d.serial) {
    // A daemon has no console to print on, so the main log says it too.
    std::string why = std::strerror(errno);
    const std::string& device = text_of(config.dialler_driver);
    std::printf("Serial driver (%s) open failed:%s\n", device.c_str(), why.c_str());
    log_message(strprintf("Serial driver (%s) open failed:", device.c_str()), why);
    return;
  }
  // Raw, 115200 baud, no modem-line control of the terminal itself. Flushing
  // first and then applying at once is TCSAFLUSH without waiting for the
  // line to drain.
  termios t{};
  bool configured = ::tcgetattr(d.serial.get(), &t) == 0;
  if (configured) {
    ::cfmakeraw(&t);
    configured = ::cfsetispeed(&t, B115200) == 0 && ::cfsetospeed(&t, B115200) == 0;
    t.c_cflag |= CLOCAL | CREAD;
    ::tcflush(d.serial.get(), TCIOFLUSH);
    configured = configured && ::tcsetattr(d.serial.get(), TCSANOW, &t) == 0;
  }
  if (!configured) log_message("tcsetattr() failed");
  log_dialler("Serial port configured");
  reset_serial_port();
  if (d.script) filecache_close(d.script);

  const std::string& path = text_of(config.dialler_script);
  if (path.empty() || link_up) return;
  d.script = filecache_open(path, FileMode::read);
  if (!d.script) {
    log_dialler(strprintf("Couldn't open dialler script:`%s'", path.c_str()));
    return;
  }
  d.script_pos = 0;
  d.state = st::script;
  status_bits |= kDiallerRunning | kNetworkChanged | status::changed;
  log_message("Dialler executing script: ", path);
  log_message("Initialising modem.");
  d.online_since = 0;
}

void disconnect() {
  progress_code = 190800;
  Dialler& d = dialler();
  if (d.script) filecache_close(d.script);
  link_probe_due = 1;
  if (hooks.link_hung_up) hooks.link_hung_up();
  d.state = st::idle;
  d.watching = false;
  link_up = 0;
  if (d.online_since) {
    long seconds = std::max<long>(0, static_cast<long>(server_now - d.online_since));
    long minutes = seconds / 60;
    seconds %= 60;
    std::string text = strprintf("Disconnecting. Online for %ld minute%s, %ld second%s.", minutes,
                                 minutes == 1 ? "" : "s", seconds, seconds == 1 ? "" : "s");
    log_message(text);
    log_write(text, logchan::dialler);
    if (!text_of(config.dialler_discmd).empty() && run_shell(text_of(config.dialler_discmd)) < 0)
      log_message("Could not start dialler.discmd");
  } else {
    log_message("Resetting modem.");
  }
  reset_serial_port();
  d.online_since = 0;
  status_bits = (status_bits & ~(kDiallerRunning | status::link_established)) | kNetworkChanged | status::changed;
  close_serial();
  d.replies.clear();
}

void link_watch() {
  progress_code = 190600;
  Dialler& d = dialler();
  if (link_up || d.state == st::idle || d.state == st::dialling || d.state == st::redial) {
    d.watching = false;
  } else if (!d.watching) {
    d.watching = true;
    d.watch_since = server_now;
  } else if (server_now - d.watch_since > config.dialler_linktime) {
    disconnect();
  }
}

void dialler_poll() {
  progress_code = 190100;
  Dialler& d = dialler();
  if (d.reset.pending && clock_ms() >= d.reset.raise_at) finish_reset(true);
  link_watch();
  if (d.reset.pending) return;  // the script waits for the port
  if ((d.state == st::complete || d.online_since) && !carrier_present()) return carrier_lost();
  switch (d.state) {
    case st::script:
      script_step();
      break;
    case st::init:
      await_ok();
      break;
    case st::dialling:
      await_dial_result();
      break;
    case st::waiting:
      await_text();
      break;
    case st::redial:
      if (server_now > d.deadline) {
        d.state = st::dialling;
        log_dialler("Redial: ", d.expect);
        write_modem(d.expect);
        d.dial_started = server_now;
      }
      break;
    case st::pausing:
      if (server_now > d.deadline) {
        d.state = st::script;
        log_dialler("Pause complete");
      }
      break;
    default:
      break;
  }
}

void dialler_shutdown() {
  disconnect();
  finish_reset(false);
}

int dialler_init() {
  hooks.dial = [] { dial(); };
  hooks.disconnect = [] { disconnect(); };
  hooks.link_watch = [] { link_watch(); };
  hooks.dialler_busy = [] { return dialler().state != st::idle; };
  return 0;
}

int dialler_state() { return dialler().state; }

std::string dialler_status_text() {
  const Dialler& d = dialler();
  return dialler_status_line(d.state, d.connect_text, link_up != 0, d.expect, d.retries_left);
}

void dialler_set_seam(DiallerSeam s) { seam = std::move(s); }

}  // namespace velmor
