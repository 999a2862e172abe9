// The file cache: every file of the suite is read and written through shared,
// cached windows. Opening a file gives a handle on a shared entry that holds a
// window of the file in memory; readers address the file by absolute offset
// and ask for the window over the offset they need; writers append through
// the buffer, which grows up to a per-file limit and is spilled to disk when
// it cannot grow. Entries of closed files stay in memory, validated against
// the file on disk (modification time to the nanosecond, size and inode), so
// files read again and again cost no disk reads.
//
// A file opened in write mode is rewritten whole: its data goes to a hidden
// temporary name beside it (".<leaf>.new", which queue scans skip), and the
// close syncs that file and renames it into place, so a crash leaves either
// the old file or the new one, never half of one.
#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <string_view>

#include "core/fileio.h"

namespace velmor {

enum class FileMode : int {
  read = 1,       // the file must exist
  write = 2,      // truncate: rewritten whole, renamed into place on close
  append = 3,     // created when missing; writes land at the end
  temporary = 4,  // a fresh file in the private tmp folder, deleted on close
  update = 5,     // read and overwrite in place; created when missing
};

struct FileCacheEntry;  // internal to the cache

// A handle on a cache entry. Move-only; destroying a handle that is still
// open closes it (errors then go unreported, so writers close explicitly and
// check the result).
class CacheFile {
 public:
  CacheFile() = default;
  explicit CacheFile(std::shared_ptr<FileCacheEntry> entry) : entry_(std::move(entry)) {}
  CacheFile(CacheFile&& other) noexcept = default;
  CacheFile& operator=(CacheFile&& other) noexcept;
  CacheFile(const CacheFile&) = delete;
  CacheFile& operator=(const CacheFile&) = delete;
  ~CacheFile();

  explicit operator bool() const { return entry_ != nullptr; }
  FileCacheEntry* entry() const { return entry_.get(); }
  std::shared_ptr<FileCacheEntry> release() { return std::move(entry_); }

 private:
  std::shared_ptr<FileCacheEntry> entry_;
};

// Raises cache.max to 32768, sets the per-file limit from cache.big (1 MB
// when it is 0) and the memory kept by unused entries from cache.max (16 MB
// when it is 0), and makes the private tmp folder. 0 = done; 1 = the tmp
// folder cannot be made.
int filecache_init();
// Drops every unused entry and writes the statistics line (channel 0).
void filecache_shutdown();

// Opens `path` in `mode`; an empty handle on failure (missing file in read
// mode, a second writer, no memory, a path too long). A second writer on a
// file that already has one is always refused, and so is a writer on a file
// that readers hold open. Readers share an append or update writer's window;
// a file being rewritten (write mode) is seen as it is on disk until its
// close puts the new one in place.
CacheFile filecache_open(const std::string& path, FileMode mode);

// Brings the window over `offset` and returns how many bytes of the file are
// available from there (0 at or past the end, or on a failure).
std::uint64_t filecache_load(CacheFile& file, std::uint64_t offset);
// filecache_load plus the bytes themselves: a view of the available bytes at
// `offset`, valid until the next call on any handle of the same entry.
std::string_view filecache_view(CacheFile& file, std::uint64_t offset);
// Copies up to `count` bytes from `offset`; returns the number copied.
std::size_t filecache_read(CacheFile& file, char* destination, std::uint64_t offset, std::size_t count);

// Writing (modes write, append, temporary, update). Each returns 0 on success
// and an errno value when the data could not be buffered or written.
int filecache_write(CacheFile& file, std::string_view data);
int filecache_puts(CacheFile& file, std::string_view text);
int filecache_putc(CacheFile& file, char byte);
// Writes the window back and fsyncs the file (append and update modes; in
// write mode the temporary file). 0 or an errno value.
int filecache_sync(CacheFile& file);
// Update and append writers: where the next write lands (at most the
// length), and cutting the file back (a delivery that failed half way).
// 0 or an errno value.
int filecache_seek(CacheFile& file, std::uint64_t offset);
int filecache_truncate(CacheFile& file, std::uint64_t length);
// Copies `count` bytes (or up to the end) of `source` from `offset` to the end
// of `destination`. 0 or an errno value, as every writing call here.
int filecache_copy(CacheFile& source, std::uint64_t offset, CacheFile& destination, std::uint64_t count);

// Closes the handle: a writing mode writes its window back (write mode syncs
// and renames into place); the entry then stays cached for readers. Returns 0
// or the errno value of the failed write, sync or rename; on failure the old
// file is untouched, except when only the folder sync after the rename
// failed: the new file is then in place but may not survive a crash.
int filecache_close(CacheFile& file);
// Close and drop the entry from memory when nobody else has it open.
int filecache_purge(CacheFile& file);
// Close and delete the file (a rewrite's new file too); other holders keep
// reading what they have open.
int filecache_destroy(CacheFile& file);
// Closes a writer without writing back what it still buffers: a rewrite
// leaves the old file untouched, a temporary file goes. The entry is dropped.
int filecache_abandon(CacheFile& file);
// Deletes a file through the cache. Handles still open on it keep reading
// what they have; the next open finds the file gone. 0 or an errno value.
int filecache_delete(const std::string& path);
// True while a writer has `path` open (a queue file still being received).
bool filecache_writing(const std::string& path);

bool filecache_at_end(CacheFile& file, std::uint64_t offset);
std::uint64_t filecache_length(const CacheFile& file);
const std::string& filecache_path(const CacheFile& file);
FileMode filecache_mode(const CacheFile& file);
int filecache_users(const CacheFile& file);

// A unique path under the private tmp folder ("<tmp>/u<hex>"), folders made.
std::string filecache_temp_name();

// ---- File helpers that keep the cache true (the plain ones are in fileio.h) --

int file_create(const std::string& path);  // create or truncate, mode 0660; 0 or an errno value
int file_rename(const std::string& from, const std::string& to);  // 0 or an errno value
// Writes `data` to `path` through a temporary name, fsync and rename: the
// file is either the old one or the new one. 0 or an errno value. When
// `backup` is set the old file is kept as `<path>~`.
int file_write_atomic(const std::string& path, std::string_view data, bool backup = false,
                      unsigned mode = 0660);

}  // namespace velmor
