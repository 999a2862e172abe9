// Process-wide state words. There is one process and one thread; these are
// plain globals, except the two that signal handlers touch.
#pragma once

#include <atomic>
#include <csignal>
#include <cstdint>
#include <ctime>
#include <string>

namespace velmor {

inline constexpr const char* kVersion = "2.0.49";
inline constexpr const char* kPlatform = "[Linux/i386]";

// time(0), refreshed at the top of every main-loop iteration. Every time-out
// and due-time test compares against it.
extern std::time_t server_now;

// Checkpoint of the code that is running (0 = idle between iterations). The
// crash handler prints it, so a crash can be placed.
extern std::atomic<std::uint32_t> progress_code;

// Set by a quit signal or the crash handler; the main loop tests it.
extern volatile std::sig_atomic_t quit_flag;

// Dial-up mail transfer state, 0..5 (see core/transfer.h).
extern int mail_transfer_state;

// The external link is known to be up / the resolver wants to probe it.
extern int link_up;
extern int link_probe_due;

// Enabled log facilities (core/log.h), from store.state at start-up.
extern std::uint32_t log_mask;

// Status-change bits for the status displays (control channel "status").
extern std::uint32_t status_bits;
namespace status {
inline constexpr std::uint32_t changed = 2;
inline constexpr std::uint32_t mail_queue_changed = 4;
inline constexpr std::uint32_t proxy_activity = 8;
inline constexpr std::uint32_t pop_client_ended = 16;
inline constexpr std::uint32_t smtp_client_ended = 32;
inline constexpr std::uint32_t news_fetch_ended = 64;
inline constexpr std::uint32_t smtp_client_running = 0x100;
inline constexpr std::uint32_t pop_client_running = 0x400;
inline constexpr std::uint32_t news_fetch_running = 0x1000;
inline constexpr std::uint32_t link_established = 0x10000;
inline constexpr std::uint32_t news_queue_changed = 0x20000;
}  // namespace status

// Every path the daemon uses. --root moves the installation, and with it
// the pid file and the control socket (in its run/ folder, which belongs to
// the suite) unless those are given separately.
struct SuitePaths {
  std::string root = "/usr/local/velmor";         // the daemon chdir()s here
  std::string pid_file = "/usr/local/velmor/run/velmor.pid";
  std::string control = "/usr/local/velmor/run/control";  // control-channel socket
  std::string tmp_dir = "/usr/local/velmor/tmp";  // private temporary files
  std::string bind_address;                       // empty = every address
  std::string master() const { return root + "/config/master"; }
  std::string master_template() const { return root + "/config/templates/master"; }
};
extern SuitePaths paths;

// This host's name: inet$hostname (with "." and inet$localdomain when that is
// set too) from the environment, else the system's host name.
const std::string& host_name();

}  // namespace velmor
