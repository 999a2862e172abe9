// The file cache: shared entries holding a window of a file, kept after the
// last close and validated against the disk at the next open.
//
// One entry exists per path (compared exactly). Each open gives its own
// handle (FileCacheEntry) on the shared entry (CacheData), so the cache knows
// which handle is the writer: only the writer's close writes back, and a
// second writer is refused while one exists. An entry that a stale hit or a
// delete takes out of the index stays alive for the handles still holding it
// and is freed at its last close.
//
// The window holds the file bytes [start, start + window). Bytes written but
// not yet on disk are the dirty range [dirty_lo, dirty_hi) inside it; moving
// the window, spilling and closing write back exactly that range.
#include "core/filecache.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <list>
#include <unordered_map>
#include <utility>

#include "core/config.h"
#include "core/fileio.h"
#include "core/globals.h"
#include "core/log.h"
#include "core/strfmt.h"

namespace velmor {

namespace {

constexpr std::uint64_t kMinBuffer = 1024;
constexpr std::uint64_t kWriteBuffer = 8192;
// A window with this few bytes left ahead of the reader is moved, so a
// reader never gets a stub of 128 bytes or less in the middle of a file.
constexpr std::uint64_t kReadAhead = 128;
constexpr std::uint64_t kDefaultFileLimit = 1024 * 1024;  // per file when cache.big is 0
constexpr std::uint64_t kDefaultMemory = 16 * 1024 * 1024;  // whole cache when cache.max is 0
constexpr std::uint64_t kLeastMemory = 32768;
constexpr std::size_t kMaxPath = 4095;
constexpr std::size_t kMaxLeaf = 255;
// A file changed this recently may change again within the same timestamp
// tick without its stamp showing it, so an unused entry of such a file is
// not trusted by its stamp: the next open reads the file again.
constexpr std::time_t kRacySeconds = 2;

// Bytes held by every window buffer (a plain global, so freeing a buffer
// during static destruction is safe).
std::uint64_t g_memory = 0;

using Fd = UniqueFd;

// A window buffer: `size` bytes and room for a NUL behind them.
class Buffer {
 public:
  Buffer() = default;
  Buffer(const Buffer&) = delete;
  Buffer& operator=(const Buffer&) = delete;
  ~Buffer() { release(); }
  char* data() { return data_; }
  std::uint64_t size() const { return size_; }
  bool resize(std::uint64_t size) {
    void* p = std::realloc(data_, size + 1);
    if (p == nullptr) return false;
    g_memory = g_memory - (data_ ? size_ + 1 : 0) + size + 1;
    data_ = static_cast<char*>(p);
    size_ = size;
    return true;
  }
  void release() {
    if (data_ == nullptr) return;
    std::free(data_);
    g_memory -= size_ + 1;
    data_ = nullptr;
    size_ = 0;
  }

 private:
  char* data_ = nullptr;
  std::uint64_t size_ = 0;
};

// What identifies one version of a file on disk.
struct Stamp {
  std::int64_t mtime_sec = 0, mtime_nsec = 0, ctime_sec = 0, ctime_nsec = 0;
  std::uint64_t size = 0;
  std::uint64_t inode = 0, device = 0;
  bool operator==(const Stamp&) const = default;
};

Stamp stamp_of(const struct stat& st) {
  return {st.st_mtim.tv_sec, st.st_mtim.tv_nsec, st.st_ctim.tv_sec, st.st_ctim.tv_nsec,
          static_cast<std::uint64_t>(st.st_size), st.st_ino, st.st_dev};
}

bool recently_changed(const Stamp& s) {
  timespec now{};
  clock_gettime(CLOCK_REALTIME, &now);
  return std::max(s.mtime_sec, s.ctime_sec) >= now.tv_sec - kRacySeconds;
}

}  // namespace

struct CacheData {
  std::string path;       // as opened; compared exactly
  std::string disk_path;  // where the bytes go: the path, or the hidden new file of a rewrite
  Buffer buffer;
  std::uint64_t start = 0;   // file offset of the window's first byte
  std::uint64_t window = 0;  // valid bytes in the window
  std::uint64_t length = 0;  // length of the file, including bytes only in the window
  std::uint64_t write_pos = 0;
  std::uint64_t dirty_lo = 0, dirty_hi = 0;  // window bytes not yet on disk
  FileMode mode = FileMode::read;            // the writer's mode while one holds it
  bool writer = false;
  bool listed = false;
  bool racy = false;
  bool keep_backup = false;  // a rewrite keeps the old file as "<path>~"
  int users = 0;
  int filetype = -1;
  Stamp stamp;
  Fd fd;  // open while the entry is used and needs the disk
  std::list<CacheData*>::iterator order_pos;

  char* at(std::uint64_t offset) { return buffer.data() + (offset - start); }
  bool whole() const { return start == 0 && window == length; }
  bool dirty() const { return dirty_lo < dirty_hi; }
  void terminate() { buffer.data()[window] = '\0'; }
};

// One open handle on an entry.
struct FileCacheEntry {
  std::shared_ptr<CacheData> data;
  FileMode mode = FileMode::read;
};

namespace {

struct Cache {
  std::unordered_map<std::string, std::shared_ptr<CacheData>> index;
  std::list<CacheData*> order;  // listed entries, most recently opened first
  std::unordered_map<std::string, CacheData*> writers;  // paths with an open writer
  std::uint64_t file_limit = kDefaultFileLimit;
  std::uint64_t memory_limit = kDefaultMemory;
  unsigned temp_counter = 0;
  unsigned unique_counter = 0;
  std::uint64_t hits = 0, misses = 0, disk_reads = 0;
};

Cache* g_cache = nullptr;  // null once the cache itself is destroyed at exit

struct CacheHolder {
  Cache cache;
  CacheHolder() { g_cache = &cache; }
  ~CacheHolder() { g_cache = nullptr; }
} g_holder;

Cache& cache() { return *g_cache; }

// Debug lines go to the main log under the fcache facility. The logger
// writes through the cache itself, so a line raised while it does is dropped.
void debug(const std::string& text) {
  static bool busy = false;
  if (busy) return;
  busy = true;
  log_message(text, {}, logfac::fcache);
  busy = false;
}

void say(const std::string& text) { std::fputs(text.c_str(), stdout); }

// ---- disk I/O, every byte checked ------------------------------------------

// Reads up to n bytes at offset; fewer only at the end of the file. -1 on error.
std::int64_t read_at(int fd, char* dst, std::uint64_t n, std::uint64_t offset) {
  std::uint64_t done = 0;
  while (done < n) {
    ssize_t r = ::pread(fd, dst + done, n - done, static_cast<off_t>(offset + done));
    if (r < 0) {
      if (errno == EINTR) continue;
      return -1;
    }
    if (r == 0) break;
    done += static_cast<std::uint64_t>(r);
  }
  if (g_cache) ++cache().disk_reads;
  return static_cast<std::int64_t>(done);
}

// Writes all n bytes at offset: 0, or the errno of the failure (a short
// write is followed by the call that reports why).
int write_at(int fd, const char* src, std::uint64_t n, std::uint64_t offset) {
  std::uint64_t done = 0;
  while (done < n) {
    ssize_t w = sysio::pwrite(fd, src + done, n - done, static_cast<off_t>(offset + done));
    if (w < 0) {
      if (errno == EINTR) continue;
      return errno;
    }
    if (w == 0) return ENOSPC;
    done += static_cast<std::uint64_t>(w);
  }
  return 0;
}

void refresh_stamp(CacheData& d) {
  struct stat st{};
  if (d.fd && ::fstat(d.fd.get(), &st) == 0) {
    d.stamp = stamp_of(st);
    d.racy = recently_changed(d.stamp);
  }
}

// Writes the dirty bytes back. A failure leaves the window as it was.
int flush(CacheData& d) {
  if (!d.dirty()) return 0;
  if (!d.fd) return EBADF;
  if (int err = write_at(d.fd.get(), d.at(d.dirty_lo), d.dirty_hi - d.dirty_lo, d.dirty_lo)) return err;
  d.dirty_lo = d.dirty_hi = 0;
  refresh_stamp(d);
  return 0;
}

void mark_dirty(CacheData& d, std::uint64_t lo, std::uint64_t hi) {
  if (!d.dirty()) {
    d.dirty_lo = lo;
    d.dirty_hi = hi;
  } else {
    d.dirty_lo = std::min(d.dirty_lo, lo);
    d.dirty_hi = std::max(d.dirty_hi, hi);
  }
}

// ---- the index and memory -----------------------------------------------------

void list_entry(const std::shared_ptr<CacheData>& d) {
  Cache& c = cache();
  auto old = c.index.find(d->path);
  if (old != c.index.end()) {
    old->second->listed = false;
    c.order.erase(old->second->order_pos);
    c.index.erase(old);
  }
  c.order.push_front(d.get());
  d->order_pos = c.order.begin();
  d->listed = true;
  c.index.emplace(d->path, d);
}

// Takes an entry out of the index. Handles still holding it keep it alive;
// without handles it is freed here.
void unlist(CacheData& d) {
  if (!d.listed || !g_cache) return;
  Cache& c = cache();
  d.listed = false;
  c.order.erase(d.order_pos);
  auto it = c.index.find(d.path);
  if (it != c.index.end() && it->second.get() == &d) c.index.erase(it);
}

bool free_oldest_unused() {
  Cache& c = cache();
  for (auto it = c.order.rbegin(); it != c.order.rend(); ++it) {
    if ((*it)->users == 0) {
      unlist(**it);
      return true;
    }
  }
  return false;
}

// Frees unused entries, oldest first, until `incoming` more bytes fit the
// memory of the cache (or nothing unused is left).
void trim(std::uint64_t incoming) {
  while (g_memory + incoming > cache().memory_limit && free_oldest_unused()) {
  }
}

// Sizes a buffer: frees unused entries when memory runs out and, when
// `may_shrink`, halves the size down to kMinBuffer. Updates `size`.
bool allocate(Buffer& buffer, std::uint64_t& size, bool may_shrink) {
  trim(size > buffer.size() ? size - buffer.size() : 0);
  for (;;) {
    if (buffer.resize(size)) return true;
    if (free_oldest_unused()) continue;
    if (!may_shrink || size / 2 < kMinBuffer) return false;
    size /= 2;
  }
}

std::uint64_t first_size(std::uint64_t length) {
  return std::clamp(length, kMinBuffer, std::max(cache().file_limit, kMinBuffer));
}

bool allocate_first(CacheData& d, std::uint64_t size) {
  if (allocate(d.buffer, size, true)) {
    d.terminate();
    return true;
  }
  debug("Not enough space - all buffers full and in use");
  say("filecache buf malloc failed\n");
  return false;
}

// Opens the file again for an entry that was closed; false when the file on
// disk is no longer the one the entry holds.
bool reopen(CacheData& d, bool for_writing) {
  Fd fd(::open(d.path.c_str(), (for_writing ? O_RDWR : O_RDONLY) | O_CLOEXEC));
  struct stat st{};
  if (!fd || ::fstat(fd.get(), &st) != 0 || stamp_of(st) != d.stamp) return false;
  d.fd = std::move(fd);
  return true;
}

bool still_valid(const CacheData& d) {
  struct stat st{};
  if (::stat(d.path.c_str(), &st) != 0 || !S_ISREG(st.st_mode)) return false;
  if (stamp_of(st) != d.stamp) return false;
  return d.users > 0 || !d.racy;
}

CacheFile make_handle(const std::shared_ptr<CacheData>& d, FileMode mode) {
  auto h = std::make_shared<FileCacheEntry>();
  h->data = d;
  h->mode = mode;
  return CacheFile(std::move(h));
}

CacheData* data_of(const CacheFile& file, const char* bad_handle_text) {
  FileCacheEntry* h = file.entry();
  if (h == nullptr || !h->data) {
    if (bad_handle_text) debug(bad_handle_text);
    return nullptr;
  }
  return h->data.get();
}

bool is_writer(const CacheFile& file) {
  return file.entry() != nullptr && file.entry()->mode != FileMode::read;
}

std::string hidden_name(const std::string& path) {
  std::string_view dir = path_dir(path);
  std::string leaf = ".";
  leaf += path_leaf(path);
  leaf += ".new";
  return dir.empty() ? leaf : path_join(dir, leaf);
}

// ---- filling new entries --------------------------------------------------------

std::shared_ptr<CacheData> fill_read(const std::string& path) {
  Fd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
  if (!fd) {
    if (errno != ENOENT && errno != ENOTDIR) say(strprintf("fcache fopen failed:%s\n", std::strerror(errno)));
    return nullptr;
  }
  struct stat st{};
  if (::fstat(fd.get(), &st) != 0 || !S_ISREG(st.st_mode)) return nullptr;
  auto d = std::make_shared<CacheData>();
  d->path = d->disk_path = path;
  d->length = static_cast<std::uint64_t>(st.st_size);
  d->stamp = stamp_of(st);
  d->racy = recently_changed(d->stamp);
  if (!allocate_first(*d, first_size(d->length))) return nullptr;
  std::uint64_t want = std::min(d->length, d->buffer.size());
  std::int64_t got = read_at(fd.get(), d->buffer.data(), want, 0);
  if (got < 0) {
    say(strprintf("fcache fread failed:%s\n", std::strerror(errno)));
    return nullptr;
  }
  // A file that shrank while it was read ends where the read ended.
  if (static_cast<std::uint64_t>(got) < want) d->length = static_cast<std::uint64_t>(got);
  d->window = static_cast<std::uint64_t>(got);
  d->terminate();
  if (!d->whole()) d->fd = std::move(fd);
  return d;
}

// Append and update: the file is created when missing.
std::shared_ptr<CacheData> fill_in_place(const std::string& path, FileMode mode) {
  Fd fd(::open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0660));
  struct stat st{};
  if (!fd || ::fstat(fd.get(), &st) != 0 || !S_ISREG(st.st_mode)) {
    say(strprintf("Create file failed:%s\n", path.c_str()));
    return nullptr;
  }
  auto d = std::make_shared<CacheData>();
  d->path = d->disk_path = path;
  d->length = static_cast<std::uint64_t>(st.st_size);
  d->stamp = stamp_of(st);
  d->fd = std::move(fd);
  if (mode == FileMode::append) {
    if (!allocate_first(*d, kWriteBuffer)) return nullptr;
    d->start = d->write_pos = d->length;
  } else {
    if (!allocate_first(*d, d->length ? first_size(d->length) : kWriteBuffer)) return nullptr;
    std::int64_t got = read_at(d->fd.get(), d->buffer.data(), std::min(d->length, d->buffer.size()), 0);
    if (got < 0) {
      say(strprintf("fcache fread failed:%s\n", std::strerror(errno)));
      return nullptr;
    }
    d->window = static_cast<std::uint64_t>(got);
    d->terminate();
  }
  return d;
}

// Write mode: the data goes to the hidden new file; the close renames it
// over the path. `create_mode` < 0 keeps the mode and owner of the file
// being replaced (0660 for a new one).
std::shared_ptr<CacheData> fill_rewrite(const std::string& path, int create_mode, bool backup, int& err) {
  struct stat target{};
  bool exists = ::stat(path.c_str(), &target) == 0;
  if (exists && !S_ISREG(target.st_mode)) {
    err = EISDIR;
    return nullptr;
  }
  if (path_leaf(path).size() + 5 > kMaxLeaf) {
    err = ENAMETOOLONG;
    return nullptr;
  }
  std::string hidden = hidden_name(path);
  Fd fd(::open(hidden.c_str(), O_RDWR | O_CREAT | O_TRUNC | O_CLOEXEC, 0660));
  if (!fd) {
    err = errno;
    say(strprintf("Create file failed:%s\n", path.c_str()));
    return nullptr;
  }
  if (create_mode >= 0) {
    ::fchmod(fd.get(), static_cast<mode_t>(create_mode));
  } else if (exists) {
    ::fchmod(fd.get(), target.st_mode & 07777);
    // A file of a user's (a home folder's settings) stays theirs; where the
    // owner cannot be kept the new file is the suite's own.
    if (::geteuid() == 0 && ::fchown(fd.get(), target.st_uid, target.st_gid) != 0) {
    }
  }
  auto d = std::make_shared<CacheData>();
  d->path = path;
  d->disk_path = std::move(hidden);
  d->fd = std::move(fd);
  d->keep_backup = backup;
  if (!allocate_first(*d, kWriteBuffer)) {
    ::unlink(d->disk_path.c_str());
    err = ENOMEM;
    return nullptr;
  }
  return d;
}

std::shared_ptr<CacheData> fill_temporary() {
  Cache& c = cache();
  Fd fd;
  std::string name;
  bool made_dir = false;
  for (int tries = 0; tries < 1000 && !fd; ++tries) {
    name = path_join(paths.tmp_dir, std::to_string(c.temp_counter++));
    fd = Fd(::open(name.c_str(), O_RDWR | O_CREAT | O_EXCL | O_CLOEXEC, 0600));
    if (fd || errno == EEXIST) continue;
    if (errno != ENOENT || made_dir) break;
    make_path(paths.tmp_dir);
    made_dir = true;
  }
  if (!fd) {
    say(strprintf("Create file failed:%s\n", name.c_str()));
    return nullptr;
  }
  auto d = std::make_shared<CacheData>();
  d->path = d->disk_path = name;
  d->fd = std::move(fd);
  d->mode = FileMode::temporary;
  d->writer = true;
  d->filetype = 4095;
  refresh_stamp(*d);
  if (!allocate_first(*d, kWriteBuffer)) {
    ::unlink(name.c_str());
    return nullptr;
  }
  return d;
}

void locked(const char* what, const CacheData& d) {
  say(strprintf("fcache %s locked %d:%s\n", what, d.users, d.path.c_str()));
}

CacheFile open_entry(const std::string& path, FileMode mode, int& err, int create_mode = -1, bool backup = false) {
  Cache& c = cache();
  err = 0;
  int m = static_cast<int>(mode);
  if (m < 1 || m > 5) {
    err = EINVAL;
    return {};
  }
  std::shared_ptr<CacheData> d;
  if (mode == FileMode::temporary) {
    d = fill_temporary();
    if (!d) {
      err = EIO;
      return {};
    }
    ++d->users;
    c.writers[d->path] = d.get();
    list_entry(d);
    return make_handle(d, mode);
  }
  if (path.empty() || path.size() > kMaxPath) {
    err = path.empty() ? ENOENT : ENAMETOOLONG;
    return {};
  }
  const char* what = mode == FileMode::write ? "write" : mode == FileMode::append ? "append" : "update";
  if (auto it = c.index.find(path); it != c.index.end()) {
    d = it->second;
    if (!still_valid(*d)) {
      unlist(*d);
    } else if (mode == FileMode::read) {
      if (d->fd || d->whole() || reopen(*d, d->writer)) {
        ++c.hits;
        ++d->users;
        c.order.splice(c.order.begin(), c.order, d->order_pos);
        return make_handle(d, mode);
      }
      unlist(*d);
    } else if (d->users > 0 || d->writer) {
      locked(what, *d);
      err = EBUSY;
      return {};
    } else if (mode == FileMode::write) {
      unlist(*d);
    } else if (reopen(*d, true)) {
      // An unused read entry becomes the writer's, window and all.
      ++c.hits;
      d->mode = mode;
      d->writer = true;
      d->write_pos = mode == FileMode::append ? d->length : 0;
      d->users = 1;
      c.writers[path] = d.get();
      c.order.splice(c.order.begin(), c.order, d->order_pos);
      return make_handle(d, mode);
    } else {
      unlist(*d);
    }
  }
  if (mode != FileMode::read) {
    if (auto w = c.writers.find(path); w != c.writers.end()) {
      locked(what, *w->second);
      err = EBUSY;
      return {};
    }
  }
  ++c.misses;
  if (mode == FileMode::read) {
    d = fill_read(path);
  } else if (mode == FileMode::write) {
    d = fill_rewrite(path, create_mode, backup, err);
  } else {
    d = fill_in_place(path, mode);
  }
  if (!d) {
    if (!err) err = errno ? errno : EIO;
    return {};
  }
  d->users = 1;
  if (mode != FileMode::read) {
    d->mode = mode;
    d->writer = true;
    c.writers[path] = d.get();
  }
  // A file being rewritten is not listed until its close puts it in place:
  // readers meanwhile see the file on disk, never half of the new one.
  if (mode != FileMode::write) list_entry(d);
  return make_handle(d, mode);
}

// ---- windows -----------------------------------------------------------------

std::uint64_t move_window(CacheData& d, std::uint64_t offset) {
  if (int err = flush(d)) {
    say(strprintf(d.mode == FileMode::temporary ? "filecache_load temp write failed %d:%s\n"
                                                : "filecache_load write1 failed %d:%s\n",
                  err, std::strerror(err)));
    return 0;
  }
  if (!d.fd && !reopen(d, d.writer)) {
    say(strprintf("filecache_load read2 failed %d:%s\n", ESTALE, std::strerror(ESTALE)));
    return 0;
  }
  std::uint64_t want = std::min(d.length - offset, d.buffer.size());
  std::int64_t got = read_at(d.fd.get(), d.buffer.data(), want, offset);
  if (got < 0) {
    int err = errno;
    say(strprintf("filecache_load read2 failed %d:%s\n", err, std::strerror(err)));
    return 0;
  }
  d.start = offset;
  d.window = static_cast<std::uint64_t>(got);
  d.terminate();
  return d.window;
}

std::uint64_t load(CacheData& d, std::uint64_t offset) {
  if (offset >= d.length) return 0;
  if (offset >= d.start && offset < d.start + d.window) {
    std::uint64_t avail = d.start + d.window - offset;
    if (d.start + d.window >= d.length || avail > kReadAhead) return avail;
  }
  return move_window(d, offset);
}

// Doubles the buffer towards `need` (plus read-ahead room), up to the
// per-file limit. False when it cannot hold `need` bytes.
bool grow(CacheData& d, std::uint64_t need) {
  std::uint64_t limit = std::max(cache().file_limit, kMinBuffer);
  if (need > limit) return false;
  std::uint64_t size = std::max<std::uint64_t>(d.buffer.size(), kMinBuffer);
  while (size < need + kReadAhead && size < limit) size *= 2;
  size = std::min(size, limit);
  if (!allocate(d.buffer, size, false)) return false;
  d.terminate();
  return true;
}

int write_data(CacheData& d, std::string_view data) {
  if (data.empty()) return 0;
  const std::uint64_t n = data.size();
  const std::uint64_t pos = d.write_pos;
  bool inside = pos >= d.start && pos <= d.start + d.window;
  if (inside && pos - d.start + n > d.buffer.size()) inside = grow(d, pos - d.start + n);
  if (!inside) {
    // Spill: what the window holds goes to disk and the window starts again
    // at the write position; data larger than the buffer goes straight out.
    if (int err = flush(d)) return err;
    if (n > d.buffer.size()) {
      if (int err = write_at(d.fd.get(), data.data(), n, pos)) return err;
      refresh_stamp(d);
      d.start = pos + n;
      d.window = 0;
      d.terminate();
      d.write_pos = pos + n;
      d.length = std::max(d.length, d.write_pos);
      return 0;
    }
    d.start = pos;
    d.window = 0;
  }
  std::memcpy(d.at(pos), data.data(), n);
  d.window = std::max(d.window, pos - d.start + n);
  d.terminate();
  mark_dirty(d, pos, pos + n);
  d.write_pos = pos + n;
  d.length = std::max(d.length, d.write_pos);
  return 0;
}


// The writer's part of a close: write back and, for a rewrite, put the new
// file in place. The entry then serves readers from memory.
int commit(const std::shared_ptr<CacheData>& dp) {
  CacheData& d = *dp;
  Cache& c = cache();
  FileMode mode = d.mode;
  d.writer = false;
  d.mode = FileMode::read;
  if (auto w = c.writers.find(d.path); w != c.writers.end() && w->second == &d) c.writers.erase(w);
  if (mode == FileMode::temporary) {
    ::unlink(d.disk_path.c_str());
    unlist(d);
    return 0;
  }
  int err = flush(d);
  if (mode != FileMode::write) {
    if (err) {
      say(strprintf("filecache_close write failed:%s\n", d.path.c_str()));
      unlist(d);  // memory no longer matches the disk
    }
    return err;
  }
  if (!err && sysio::fsync(d.fd.get()) != 0) err = errno;
  if (!err && d.keep_backup && file_is_regular(d.path)) {
    std::string backup = d.path + "~";
    ::unlink(backup.c_str());
    if (::link(d.path.c_str(), backup.c_str()) != 0) err = errno;
  }
  if (!err && sysio::rename(d.disk_path.c_str(), d.path.c_str()) != 0) err = errno;
  if (err) {
    say(strprintf("filecache_close write failed:%s\n", d.path.c_str()));
    ::unlink(d.disk_path.c_str());
    return err;
  }
  // The new file is in place; a folder that cannot be synced may still lose
  // the rename in a crash, so the caller is told, and keeps its own copy.
  err = sync_parent_dir(d.path);
  d.disk_path = d.path;
  refresh_stamp(d);
  list_entry(dp);
  return err;
}

// Closes one handle. `purge` also drops the entry when nobody else has it.
int close_handle(const std::shared_ptr<FileCacheEntry>& h, bool purge) {
  if (!g_cache) return 0;
  std::shared_ptr<CacheData> d = h->data;
  h->data.reset();
  --d->users;
  int err = h->mode != FileMode::read ? commit(d) : 0;
  if (d->users == 0) {
    if (purge) unlist(*d);
    if (d->listed) {
      d->fd.close();  // an unused entry holds memory, not descriptors
      trim(0);
    }
  }
  return err;
}

}  // namespace

// ---- the handle ---------------------------------------------------------------------

CacheFile& CacheFile::operator=(CacheFile&& other) noexcept {
  if (this != &other) {
    if (entry_) filecache_close(*this);
    entry_ = std::move(other.entry_);
  }
  return *this;
}

CacheFile::~CacheFile() {
  if (entry_ && g_cache) filecache_close(*this);
}

// ---- the operations -------------------------------------------------------------

int filecache_init() {
  Cache& c = cache();
  std::uint64_t big = config.cache_big > 0 ? static_cast<std::uint64_t>(config.cache_big) : 0;
  c.file_limit = big ? std::max(big - 1, kMinBuffer) : kDefaultFileLimit;
  c.memory_limit = config.cache_max > 0 ? std::max<std::uint64_t>(config.cache_max, kLeastMemory) : kDefaultMemory;
  if (config.cache_max < static_cast<std::int32_t>(kLeastMemory)) config.cache_max = kLeastMemory;
  make_path(paths.tmp_dir);
  if (!file_is_directory(paths.tmp_dir)) {
    say(strprintf("Couldn't make the tmp folder:%s\n", paths.tmp_dir.c_str()));
    return 1;
  }
  return 0;
}

void filecache_shutdown() {
  Cache& c = cache();
  while (free_oldest_unused()) {
  }
  using ull = unsigned long long;
  log_write(strprintf("File cache: %llu hits, %llu misses, %llu disk reads, %llu bytes held", ull{c.hits},
                      ull{c.misses}, ull{c.disk_reads}, ull{g_memory}),
            logchan::fcache_stats);
}

CacheFile filecache_open(const std::string& path, FileMode mode) {
  int err = 0;
  return open_entry(path, mode, err);
}

std::uint64_t filecache_load(CacheFile& file, std::uint64_t offset) {
  CacheData* d = data_of(file, "Invalid struct key (load)");
  return d ? load(*d, offset) : 0;
}

std::string_view filecache_view(CacheFile& file, std::uint64_t offset) {
  CacheData* d = data_of(file, "Invalid struct key (load)");
  if (!d) return {};
  std::uint64_t n = load(*d, offset);
  return n ? std::string_view(d->at(offset), n) : std::string_view();
}

std::size_t filecache_read(CacheFile& file, char* destination, std::uint64_t offset, std::size_t count) {
  CacheData* d = data_of(file, "Invalid struct key (read)");
  if (!d || destination == nullptr || count == 0 || offset > d->length) return 0;
  std::size_t copied = 0;
  while (copied < count) {
    std::uint64_t n = load(*d, offset + copied);
    if (n == 0) break;
    std::size_t take = static_cast<std::size_t>(std::min<std::uint64_t>(n, count - copied));
    std::memcpy(destination + copied, d->at(offset + copied), take);
    copied += take;
  }
  return copied;
}

int filecache_write(CacheFile& file, std::string_view data) {
  CacheData* d = data_of(file, nullptr);
  if (!d) {
    debug("Invalid struct key (write): 0");
    return EBADF;
  }
  if (!is_writer(file)) return EBADF;
  return write_data(*d, data);
}

int filecache_puts(CacheFile& file, std::string_view text) { return filecache_write(file, text); }

int filecache_putc(CacheFile& file, char byte) {
  CacheData* d = data_of(file, "Invalid struct key (putc)");
  if (!d) return EBADF;
  if (!is_writer(file)) return EBADF;
  std::uint64_t pos = d->write_pos;
  if (pos >= d->start && pos <= d->start + d->window && pos - d->start < d->buffer.size()) {
    *d->at(pos) = byte;
    d->window = std::max(d->window, pos - d->start + 1);
    d->terminate();
    mark_dirty(*d, pos, pos + 1);
    d->write_pos = pos + 1;
    d->length = std::max(d->length, d->write_pos);
    return 0;
  }
  return write_data(*d, std::string_view(&byte, 1));
}

int filecache_sync(CacheFile& file) {
  CacheData* d = data_of(file, "Invalid struct key (sync)");
  if (!d) return EBADF;
  if (!is_writer(file)) return 0;
  if (int err = flush(*d)) return err;
  if (sysio::fsync(d->fd.get()) != 0) return errno;
  return 0;
}

int filecache_seek(CacheFile& file, std::uint64_t offset) {
  CacheData* d = data_of(file, "Invalid struct key (seek)");
  if (!d) return EBADF;
  if (!is_writer(file) || offset > d->length) return EINVAL;
  d->write_pos = offset;
  return 0;
}

int filecache_truncate(CacheFile& file, std::uint64_t length) {
  CacheData* d = data_of(file, "Invalid struct key (truncate)");
  if (!d) return EBADF;
  if (!is_writer(file) || length > d->length) return EINVAL;
  if (sysio::ftruncate(d->fd.get(), static_cast<off_t>(length)) != 0) return errno;
  if (d->start > length) d->start = length;
  d->window = std::min(d->window, length - d->start);
  d->terminate();
  d->dirty_hi = std::min(d->dirty_hi, length);
  if (d->dirty_lo >= d->dirty_hi) d->dirty_lo = d->dirty_hi = 0;
  d->length = length;
  d->write_pos = std::min(d->write_pos, length);
  refresh_stamp(*d);
  return 0;
}

int filecache_copy(CacheFile& source, std::uint64_t offset, CacheFile& destination, std::uint64_t count) {
  CacheData* s = data_of(source, "Invalid struct key (copy in)");
  if (!s) return EBADF;
  CacheData* d = data_of(destination, "Invalid struct key (copy out)");
  if (!d) return EBADF;
  if (!is_writer(destination)) return EBADF;
  std::string chunk;  // the same entry on both sides: the window moves under us
  while (count > 0 && offset < s->length) {
    std::uint64_t n = load(*s, offset);
    if (n == 0) {
      debug("no space");
      return EIO;
    }
    n = std::min(n, count);
    std::string_view piece(s->at(offset), n);
    if (s == d) piece = chunk.assign(piece);
    if (int err = write_data(*d, piece)) return err;
    offset += n;
    count -= n;
  }
  return 0;
}

int filecache_close(CacheFile& file) {
  std::shared_ptr<FileCacheEntry> h = file.release();
  if (!h || !h->data) {
    debug("Invalid close handle");
    return 0;
  }
  return close_handle(h, false);
}

int filecache_purge(CacheFile& file) {
  std::shared_ptr<FileCacheEntry> h = file.release();
  if (!h || !h->data) {
    debug("Invalid struct key (destroy)");
    return 0;
  }
  return close_handle(h, true);
}

int filecache_destroy(CacheFile& file) {
  std::shared_ptr<FileCacheEntry> h = file.release();
  if (!h || !h->data) {
    debug("Invalid struct key (destroy)");
    return 0;
  }
  std::shared_ptr<CacheData> d = h->data;
  h->data.reset();
  --d->users;
  if (h->mode != FileMode::read) {
    // The writer goes without writing back: the file is deleted anyway.
    Cache& c = cache();
    d->writer = false;
    d->dirty_lo = d->dirty_hi = 0;
    if (auto w = c.writers.find(d->path); w != c.writers.end() && w->second == d.get()) c.writers.erase(w);
  }
  // Deleted now: holders that remain keep reading what they have open.
  int err = 0;
  if (d->disk_path != d->path) ::unlink(d->disk_path.c_str());
  if (::unlink(d->path.c_str()) != 0 && errno != ENOENT) err = errno;
  unlist(*d);
  return err;
}

int filecache_abandon(CacheFile& file) {
  std::shared_ptr<FileCacheEntry> h = file.release();
  if (!h || !h->data) {
    debug("Invalid struct key (remove)");
    return 0;
  }
  std::shared_ptr<CacheData> d = h->data;
  h->data.reset();
  --d->users;
  if (h->mode == FileMode::read) return 0;
  Cache& c = cache();
  d->writer = false;
  d->dirty_lo = d->dirty_hi = 0;
  if (auto w = c.writers.find(d->path); w != c.writers.end() && w->second == d.get()) c.writers.erase(w);
  if (d->disk_path != d->path || h->mode == FileMode::temporary) ::unlink(d->disk_path.c_str());
  unlist(*d);  // what it holds may differ from the disk
  return 0;
}

int filecache_delete(const std::string& path) {
  if (path.empty()) return ENOENT;
  Cache& c = cache();
  if (auto it = c.index.find(path); it != c.index.end()) unlist(*it->second);
  return ::unlink(path.c_str()) == 0 ? 0 : errno;
}

bool filecache_writing(const std::string& path) { return cache().writers.count(path) != 0; }

bool filecache_at_end(CacheFile& file, std::uint64_t offset) {
  CacheData* d = data_of(file, nullptr);
  return d == nullptr || offset >= d->length;
}

std::uint64_t filecache_length(const CacheFile& file) {
  CacheData* d = data_of(file, nullptr);
  return d ? d->length : 0;
}

const std::string& filecache_path(const CacheFile& file) {
  static const std::string none;
  CacheData* d = data_of(file, nullptr);
  return d ? d->path : none;
}

FileMode filecache_mode(const CacheFile& file) {
  return file.entry() ? file.entry()->mode : FileMode::read;
}

int filecache_users(const CacheFile& file) {
  CacheData* d = data_of(file, nullptr);
  return d ? d->users : 0;
}

std::string filecache_temp_name() {
  Cache& c = cache();
  make_path(paths.tmp_dir);
  for (;;) {
    std::string name = path_join(paths.tmp_dir, strprintf("u%x", c.unique_counter++));
    struct stat st{};
    if (::lstat(name.c_str(), &st) != 0) return name;
  }
}

// ---- file helpers that know the cache ------------------------------------

int file_create(const std::string& path) {
  if (g_cache) {
    if (auto it = cache().index.find(path); it != cache().index.end()) unlist(*it->second);
  }
  Fd fd(::open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0660));
  return fd ? 0 : errno;
}

int file_rename(const std::string& from, const std::string& to) {
  if (g_cache) {
    for (const std::string* p : {&from, &to}) {
      if (auto it = cache().index.find(*p); it != cache().index.end()) unlist(*it->second);
    }
  }
  return sysio::rename(from.c_str(), to.c_str()) == 0 ? 0 : errno;
}

int file_write_atomic(const std::string& path, std::string_view data, bool backup, unsigned mode) {
  int err = 0;
  CacheFile file = open_entry(path, FileMode::write, err, static_cast<int>(mode & 07777), backup);
  if (!file) return err ? err : EIO;
  if ((err = filecache_write(file, data)) != 0) {
    filecache_abandon(file);
    return err;
  }
  return filecache_close(file);
}

}  // namespace velmor
