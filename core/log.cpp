// The logger. The log configuration file routes numbered channels to files;
// each file has its own buffer, flush interval, size limit and number of kept
// generations. A file is opened for every direct write or flush and closed
// again, so an outside tool may move it away at any time.
#include "core/log.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <memory>
#include <vector>

#include "core/config.h"
#include "core/filecache.h"
#include "core/fileio.h"
#include "core/globals.h"
#include "core/strfmt.h"
#include "core/textfile.h"
#include "core/util.h"

namespace velmor {

namespace {

// A stamped line needs at most this much beyond its text, so a buffered
// write never overflows the buffer.
constexpr std::size_t kHeadroom = 128;

struct LogFile {
  std::string path;
  std::string buffer;        // pending text, at most buffer_size bytes
  std::size_t buffer_size = 1024;
  std::time_t flush_interval = 0;  // seconds; 0 = no timed flush
  std::int64_t max_size = 0;       // bytes; 0 = no limit
  int keep = 0;                    // old generations kept on rotation
  std::time_t next_flush = 0;
};

struct LogRoute {
  int channel;
  LogFile* file;
};

std::vector<std::unique_ptr<LogFile>> files;
std::vector<LogRoute> routes;  // in file order; the last line of a channel counts
std::string error_path;        // channel 1's file, for the crash handler

LogFile* route_for(int channel) {
  for (auto it = routes.rbegin(); it != routes.rend(); ++it)
    if (it->channel == channel) return it->file;
  return nullptr;
}

std::string stamp() {
  std::time_t now = server_now;
  std::tm local{};
  localtime_r(&now, &local);
  char text[64];
  std::size_t n = std::strftime(text, sizeof text, "%H:%M:%S, %d %b -> ", &local);
  return std::string(text, n);
}

// P -> P1 -> P2 ... up to `keep` generations; P itself is gone afterwards, so
// the next write starts a new file.
void rotate(const LogFile& f) {
  if (f.keep > 0) {
    std::remove(strprintf("%s%d", f.path.c_str(), f.keep).c_str());
    for (int n = f.keep - 1; n >= 1; --n)
      std::rename(strprintf("%s%d", f.path.c_str(), n).c_str(), strprintf("%s%d", f.path.c_str(), n + 1).c_str());
    std::rename(f.path.c_str(), (f.path + "1").c_str());
  }
  std::remove(f.path.c_str());
}

// Appends `data` to the file; rotates when it has outgrown its limit.
// false when the file cannot be opened.
bool append_to_file(LogFile& f, std::string_view data) {
  int fd = ::open(f.path.c_str(), O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC, 0660);
  if (fd < 0) return false;
  write_all_unwatched(fd, data);
  struct stat st {};
  std::int64_t size = ::fstat(fd, &st) == 0 ? static_cast<std::int64_t>(st.st_size) : 0;
  ::fchmod(fd, 0660);
  ::close(fd);
  if (f.max_size > 0 && size > f.max_size) rotate(f);
  return true;
}

void flush(LogFile& f) {
  if (f.buffer.empty()) return;
  append_to_file(f, f.buffer);  // an unopenable file loses the buffered text
  f.buffer.clear();
  if (f.flush_interval) f.next_flush = server_now + f.flush_interval;
}

const char* facility_prefix(std::uint32_t facility) {
  switch (facility) {
    case logfac::smtp: return "SMTP: ";
    case logfac::pop: return "POP: ";
    case logfac::imap: return "IMAP: ";
    case logfac::maildebatch: return "Mail Debatch: ";
    case logfac::newsfetch: return "News Fetch: ";
    case logfac::newsserver: return "News Server: ";
    case logfac::newsdebatch: return "News Debatch: ";
    case logfac::web: return "Web: ";
    case logfac::proxy: return "Proxy: ";
    case logfac::dns: return "DNS: ";
    case logfac::fcache: return "FCache: ";
    case logfac::schedule: return "Scheduler: ";
    case logfac::dialler: return "Dialler: ";
    case logfac::utils: return "Utils: ";
    default: return "";
  }
}

// One route line: channel, path, then optionally buffer bytes, flush minutes,
// size limit in kilobytes and kept generations.
void parse_route(std::string_view line) {
  std::vector<std::string> fields;
  std::size_t i = 0;
  while (i < line.size()) {
    while (i < line.size() && (line[i] == ' ' || line[i] == '\t')) ++i;
    std::size_t start = i;
    while (i < line.size() && line[i] != ' ' && line[i] != '\t') ++i;
    if (i > start) fields.emplace_back(line.substr(start, i - start));
  }
  if (fields.size() < 2) return;
  // Numbers are kept within sensible bounds, so no setting can overflow.
  auto number = [&](std::size_t n) {
    return n < fields.size() ? std::clamp(std::strtoll(fields[n].c_str(), nullptr, 10), 0LL, 1LL << 30) : 0LL;
  };
  const std::string& path = fields[1];
  LogFile* file = nullptr;
  for (auto& f : files)
    if (f->path == path) file = f.get();
  if (!file) {
    // A path named again keeps the settings of its first line.
    auto f = std::make_unique<LogFile>();
    f->path = path;
    long long size = number(2);
    f->buffer_size = size > 0 ? static_cast<std::size_t>(size) : 1024;
    f->flush_interval = static_cast<std::time_t>(number(3)) * 60;
    f->max_size = number(4) * 1024;
    f->keep = static_cast<int>(std::clamp(number(5), 0LL, 1000LL));
    f->next_flush = server_now;
    file = f.get();
    files.push_back(std::move(f));
  }
  routes.push_back({static_cast<int>(number(0)), file});
}

}  // namespace

int log_init() {
  log_reset();
  std::string path = text_of(config.file_log_master);
  std::optional<std::string> text = read_text_file(path);
  if (!text) {
    std::printf("couldn't open log config file:'%s'\n", path.c_str());
    std::fflush(stdout);
    return 1;
  }
  log_parse(*text);
  for (const auto& f : files) make_parent_dirs(f->path);
  return 0;
}

void log_parse(std::string_view text) {
  log_reset();
  for_each_line(text, [](std::string_view line) {
    if (!line.empty() && line[0] >= '0' && line[0] <= '9') parse_route(line);
  });
  if (LogFile* f = route_for(logchan::errors)) error_path = f->path;
}

void log_reset() {
  routes.clear();
  files.clear();
  error_path.clear();
}

const char* log_error_channel_path() { return error_path.empty() ? nullptr : error_path.c_str(); }

int log_write(std::string_view text, int channel, int flags) {
  LogFile* f = route_for(channel);
  if (!f) return 1;
  if (flags & kLogFlush) {
    flush(*f);
    return 0;
  }
  if (text.data() == nullptr) return 0;
  const bool buffered = !(flags & kLogUnbuffered);
  if (!f->buffer.empty() && (!buffered || f->buffer.size() + text.size() + kHeadroom > f->buffer_size)) flush(*f);

  std::string line;
  if (!(flags & kLogNoStamp)) line = stamp();
  line += text;
  if (!(flags & kLogNoNewline)) line += '\n';
  if (buffered && text.size() + kHeadroom <= f->buffer_size) {
    f->buffer += line;
    return 0;
  }
  return append_to_file(*f, line) ? 0 : 1;
}

void log_message(std::string_view text, std::string_view value, std::uint32_t facility) {
  if ((facility & log_mask) == 0 || (log_mask & logfac::silence)) return;
  std::string line = facility_prefix(facility);
  line += text;
  line += value;
  log_write(line, logchan::main);
  log_write({}, logchan::main, kLogFlush);  // the main log is complete at any moment
}

void log_poll() {
  for (auto& f : files)
    if (f->flush_interval && !f->buffer.empty() && f->next_flush < server_now) flush(*f);
}

void log_flush_all() {
  for (auto& f : files) flush(*f);
}

// One write for the whole block, however the channel is buffered: a
// message's lines cost one append, not one each.
void log_header_summary(std::string_view tag, std::string_view header_text) {
  std::string block;
  std::string_view rest = header_text;
  while (!rest.empty()) {
    std::size_t end = rest.find('\n');
    std::string_view line = rest.substr(0, end);
    rest = end == std::string_view::npos ? std::string_view{} : rest.substr(end + 1);
    if (!line.empty() && line.back() == '\r') line.remove_suffix(1);
    if (line.empty()) break;  // the end of the header block
    if (str_istarts_with(line, "From:") || str_istarts_with(line, "To:") ||
        str_istarts_with(line, "Message-ID:") || line.substr(0, 8) == "Subject:") {
      std::string out(tag);
      out += " - ";
      out += line;
      if (out.size() > 254) out.resize(254);
      block += stamp() + out + '\n';
    }
  }
  if (!block.empty()) log_write(block, logchan::mail, kLogNoStamp | kLogNoNewline);
}

}  // namespace velmor
