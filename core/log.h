// The logger: numbered channels routed to files by the log configuration
// file, with buffering, timed flushes and rotation; and the main-log call
// that nearly every subsystem uses, filtered by facility bits.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>

namespace velmor {

// Facility bits of log_mask, with the control-channel word that switches each.
namespace logfac {
inline constexpr std::uint32_t house = 2;          // "house" (no prefix)
inline constexpr std::uint32_t smtp = 4;           // "SMTP: "
inline constexpr std::uint32_t pop = 8;            // "POP: "
inline constexpr std::uint32_t imap = 16;          // "IMAP: "
inline constexpr std::uint32_t maildebatch = 32;   // "Mail Debatch: "
inline constexpr std::uint32_t newsfetch = 64;     // "News Fetch: "
inline constexpr std::uint32_t newsserver = 128;   // "News Server: "
inline constexpr std::uint32_t newsdebatch = 256;  // "News Debatch: "
inline constexpr std::uint32_t web = 512;          // "Web: "
inline constexpr std::uint32_t proxy = 1024;       // "Proxy: "
inline constexpr std::uint32_t dns = 2048;         // "DNS: "
inline constexpr std::uint32_t fcache = 4096;      // "FCache: "
inline constexpr std::uint32_t schedule = 8192;    // "Scheduler: "
inline constexpr std::uint32_t dialler = 16384;    // "Dialler: "
inline constexpr std::uint32_t utils = 32768;      // "Utils: "
inline constexpr std::uint32_t silence = 0x40000000;  // in log_mask: no log call writes
}  // namespace logfac

// Channels written by the suite.
namespace logchan {
inline constexpr int fcache_stats = 0;
inline constexpr int errors = 1;       // serious errors, the crash line
inline constexpr int main = 2;         // every log_message
inline constexpr int proxy_access = 4;
inline constexpr int proxy_relay = 5;
inline constexpr int cache_request = 6;
inline constexpr int web_access = 7;
inline constexpr int mail = 8;         // header summaries, SMTP transfer lines
inline constexpr int mail_trace = 9;   // debatch records
inline constexpr int filter = 12;      // mail and content filter hits
inline constexpr int dialler = 13;
}  // namespace logchan

// log_write flags
inline constexpr int kLogUnbuffered = 1;
inline constexpr int kLogNoStamp = 2;
inline constexpr int kLogFlush = 4;
inline constexpr int kLogNoNewline = 8;

// Reads the log configuration file (config.file_log_master). 0; 1 when the file
// cannot be opened (after "couldn't open log config file:'%s'\n" on stdout).
int log_init();
// What log_init does with the file's text: replaces every route and file
// with those of the text (creating no folders).
void log_parse(std::string_view text);

// The log call: a stamped line "time prefix text value" on channel 2 when
// `facility` is enabled in log_mask. The main log is flushed at once.
void log_message(std::string_view text, std::string_view value = {},
                 std::uint32_t facility = logfac::house);

// The channel writer. Returns 0; 1 when the channel has no route or its file
// cannot be opened.
int log_write(std::string_view text, int channel, int flags = 0);

void log_poll();       // timed flushes, once per main-loop iteration
void log_flush_all();  // every buffer, at shutdown

// One line per From/To/Message-ID/Subject header of a header block, channel
// 8, each "<tag> - <line>" (the tag names the connection and its client).
void log_header_summary(std::string_view tag, std::string_view header_text);
// The same with a message or transfer number as the tag.
inline void log_header_summary(int number, std::string_view header_text) {
  log_header_summary(std::to_string(number), header_text);
}

// The path routed to channel 1, for the crash handler (which may only use
// async-signal-safe calls): a NUL-terminated copy kept at log_init time.
const char* log_error_channel_path();

// Drops every route and file (tests).
void log_reset();

}  // namespace velmor
