#include "core/filecache.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <string>

#include <gtest/gtest.h>

#include "core/config.h"
#include "core/globals.h"
#include "core/test_files.h"

namespace velmor {
namespace {

std::string slurp(const std::string& path) {
  std::string out;
  int fd = ::open(path.c_str(), O_RDONLY);
  if (fd < 0) return "<missing>";
  char buf[4096];
  ssize_t n;
  while ((n = ::read(fd, buf, sizeof buf)) > 0) out.append(buf, static_cast<size_t>(n));
  ::close(fd);
  return out;
}

void put(const std::string& path, const std::string& data) {
  int fd = ::open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
  ASSERT_GE(fd, 0);
  ASSERT_EQ(::write(fd, data.data(), data.size()), static_cast<ssize_t>(data.size()));
  ::close(fd);
}

// A file whose bytes tell their own offsets apart.
std::string pattern(std::size_t n) {
  std::string s(n, '\0');
  for (std::size_t i = 0; i < n; ++i) s[i] = static_cast<char>('a' + (i * 7 + i / 251) % 26);
  return s;
}

// Reads a whole file through the cache the way the services do: view by
// view at absolute offsets.
std::string walk(CacheFile& f) {
  std::string out;
  std::uint64_t pos = 0;
  for (std::string_view v; !(v = filecache_view(f, pos)).empty(); pos += v.size()) out.append(v);
  return out;
}

class FileCacheTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_FALSE(scratch_.path().empty());
    dir_ = scratch_.path().string();
    paths.tmp_dir = dir_ + "/tmp";
    config.cache_big = 0;
    config.cache_max = 0;
    ASSERT_EQ(filecache_init(), 0);
  }
  void TearDown() override { filecache_shutdown(); }
  std::string at(const std::string& name) const { return dir_ + "/" + name; }
  void limit_file_size(int kilobytes) {
    config.cache_big = kilobytes * 1024;
    ASSERT_EQ(filecache_init(), 0);
  }

  testing_files::ScratchDir scratch_;
  std::string dir_;
};

TEST_F(FileCacheTest, ModesCreateOrRequireTheFile) {
  EXPECT_FALSE(filecache_open(at("missing"), FileMode::read));
  EXPECT_FALSE(filecache_open("", FileMode::read));
  EXPECT_FALSE(filecache_open(at("dir/../x"), FileMode::read));
  EXPECT_FALSE(filecache_open(std::string(5000, 'a'), FileMode::append));
  EXPECT_FALSE(filecache_open(at("x"), static_cast<FileMode>(9)));
  EXPECT_FALSE(filecache_open(dir_, FileMode::read));  // a folder is no file

  for (auto [name, mode] : {std::pair{"a", FileMode::append}, std::pair{"u", FileMode::update}}) {
    CacheFile f = filecache_open(at(name), mode);
    ASSERT_TRUE(f);
    EXPECT_EQ(file_size(at(name)), 0);
    EXPECT_EQ(filecache_close(f), 0);
  }
  // A rewrite appears at its path only when it is complete.
  CacheFile w = filecache_open(at("w"), FileMode::write);
  ASSERT_TRUE(w);
  EXPECT_EQ(filecache_write(w, "new"), 0);
  EXPECT_FALSE(file_is_regular(at("w")));
  EXPECT_TRUE(filecache_writing(at("w")));
  EXPECT_EQ(filecache_close(w), 0);
  EXPECT_FALSE(filecache_writing(at("w")));
  EXPECT_EQ(slurp(at("w")), "new");
  EXPECT_FALSE(file_is_regular(at(".w.new")));
}

TEST_F(FileCacheTest, ReadersShareOneEntryAndSeeChangesOnDisk) {
  put(at("f"), "version one\n");
  CacheFile a = filecache_open(at("f"), FileMode::read);
  CacheFile b = filecache_open(at("f"), FileMode::read);
  ASSERT_TRUE(a && b);
  EXPECT_EQ(filecache_users(a), 2);
  EXPECT_EQ(walk(b), "version one\n");
  // Paths are compared exactly: another spelling is another file.
  EXPECT_FALSE(filecache_open(at("F"), FileMode::read));

  // Rewritten in place with the same size, at once: the next open must not
  // trust a timestamp that may not have moved.
  put(at("f"), "version two\n");
  EXPECT_EQ(walk(a), "version one\n");  // holders keep what they opened
  filecache_close(a);
  filecache_close(b);
  CacheFile c = filecache_open(at("f"), FileMode::read);
  EXPECT_EQ(walk(c), "version two\n");
  filecache_close(c);

  // Replaced by another file (another inode) while a reader holds the old
  // one: the next open gets the new file, the holder keeps the old, and the
  // old entry goes at its last close.
  put(at("g"), "three");
  CacheFile held = filecache_open(at("f"), FileMode::read);
  ASSERT_EQ(::rename(at("g").c_str(), at("f").c_str()), 0);
  CacheFile d = filecache_open(at("f"), FileMode::read);
  EXPECT_EQ(walk(d), "three");
  EXPECT_EQ(filecache_users(d), 1);
  EXPECT_EQ(walk(held), "version two\n");
  filecache_close(held);
  filecache_close(d);
  ASSERT_EQ(::unlink(at("f").c_str()), 0);
  EXPECT_FALSE(filecache_open(at("f"), FileMode::read));
}

TEST_F(FileCacheTest, WindowsWalkAFileLargerThanTheBuffer) {
  limit_file_size(16);
  const std::string text = pattern(100000);
  put(at("big"), text);
  CacheFile f = filecache_open(at("big"), FileMode::read);
  ASSERT_TRUE(f);
  EXPECT_EQ(filecache_length(f), text.size());
  EXPECT_EQ(walk(f), text);

  // The window over 0 ends at 16383; 100 bytes before that it is moved, so
  // the reader gets more than a stub.
  ASSERT_EQ(filecache_load(f, 0), 16383u);
  EXPECT_EQ(filecache_load(f, 16283), 16383u);
  EXPECT_EQ(filecache_view(f, 16283).substr(0, 50), text.substr(16283, 50));
  // The last bytes are returned as they are.
  EXPECT_EQ(filecache_view(f, text.size() - 10), text.substr(text.size() - 10));
  EXPECT_EQ(filecache_load(f, text.size()), 0u);
  EXPECT_TRUE(filecache_at_end(f, text.size()));

  // Reads across window edges copy exactly what was asked.
  std::string buf(100, '\0');
  for (std::uint64_t off : {16333ull, 50000ull, 99950ull, 0ull}) {
    std::size_t n = filecache_read(f, buf.data(), off, 100);
    EXPECT_EQ(n, std::min<std::size_t>(100, text.size() - off));
    EXPECT_EQ(buf.substr(0, n), text.substr(off, n)) << off;
  }
  filecache_close(f);
}

TEST_F(FileCacheTest, WritersBufferAndWriteBackOnClose) {
  put(at("box"), "first\n");
  CacheFile w = filecache_open(at("box"), FileMode::append);
  ASSERT_TRUE(w);
  EXPECT_EQ(filecache_puts(w, "second\n"), 0);
  EXPECT_EQ(filecache_putc(w, '!'), 0);
  EXPECT_EQ(filecache_length(w), 14u);
  EXPECT_EQ(slurp(at("box")), "first\n");  // still in the window

  // A reader shares the writer's window and sees the buffered bytes; its
  // close does not end the writer.
  CacheFile r = filecache_open(at("box"), FileMode::read);
  ASSERT_TRUE(r);
  EXPECT_EQ(walk(r), "first\nsecond\n!");
  EXPECT_EQ(filecache_write(r, "x"), EBADF);
  filecache_close(r);
  EXPECT_EQ(filecache_write(w, "\n"), 0);
  EXPECT_EQ(filecache_close(w), 0);
  EXPECT_EQ(slurp(at("box")), "first\nsecond\n!\n");

  // The closed entry serves the next reader, then turns into an appender.
  CacheFile again = filecache_open(at("box"), FileMode::read);
  EXPECT_EQ(walk(again), "first\nsecond\n!\n");
  filecache_close(again);
  CacheFile more = filecache_open(at("box"), FileMode::append);
  ASSERT_TRUE(more);
  filecache_puts(more, "third\n");
  EXPECT_EQ(filecache_sync(more), 0);
  EXPECT_EQ(slurp(at("box")), "first\nsecond\n!\nthird\n");
  EXPECT_EQ(filecache_truncate(more, 6), 0);  // a delivery taken back
  EXPECT_EQ(filecache_close(more), 0);
  EXPECT_EQ(slurp(at("box")), "first\n");

  // Update mode overwrites in place at the position given.
  CacheFile u = filecache_open(at("box"), FileMode::update);
  ASSERT_TRUE(u);
  EXPECT_EQ(filecache_seek(u, 1), 0);
  EXPECT_EQ(filecache_seek(u, 99), EINVAL);
  filecache_puts(u, "IRS");
  EXPECT_EQ(walk(u), "fIRSt\n");
  EXPECT_EQ(filecache_close(u), 0);
  EXPECT_EQ(slurp(at("box")), "fIRSt\n");
}

TEST_F(FileCacheTest, WritesBeyondTheLimitSpillToDisk) {
  limit_file_size(16);
  const std::string text = pattern(20 * 1024);
  CacheFile w = filecache_open(at("spill"), FileMode::write);
  ASSERT_TRUE(w);
  ASSERT_EQ(filecache_write(w, text), 0);
  EXPECT_EQ(filecache_length(w), text.size());
  EXPECT_EQ(walk(w), text);  // read back through the hidden new file
  ASSERT_EQ(filecache_close(w), 0);
  EXPECT_EQ(slurp(at("spill")), text);

  // Many small writes past the limit, and an update in the middle of a file
  // whose window has moved on.
  const std::string long_text = pattern(70000);
  CacheFile a = filecache_open(at("log"), FileMode::append);
  for (std::size_t i = 0; i < long_text.size(); i += 700) ASSERT_EQ(filecache_write(a, long_text.substr(i, 700)), 0);
  EXPECT_EQ(walk(a).size(), long_text.size());
  ASSERT_EQ(filecache_close(a), 0);
  EXPECT_EQ(slurp(at("log")), long_text);

  CacheFile u = filecache_open(at("log"), FileMode::update);
  ASSERT_TRUE(u);
  filecache_load(u, 60000);
  ASSERT_EQ(filecache_seek(u, 100), 0);
  ASSERT_EQ(filecache_write(u, "HELLO"), 0);
  ASSERT_EQ(filecache_close(u), 0);
  std::string expect = long_text;
  expect.replace(100, 5, "HELLO");
  EXPECT_EQ(slurp(at("log")), expect);
}

TEST_F(FileCacheTest, OneWriterAtATime) {
  CacheFile w = filecache_open(at("q"), FileMode::append);
  ASSERT_TRUE(w);
  EXPECT_FALSE(filecache_open(at("q"), FileMode::append));
  EXPECT_FALSE(filecache_open(at("q"), FileMode::update));
  EXPECT_FALSE(filecache_open(at("q"), FileMode::write));
  filecache_close(w);

  CacheFile r = filecache_open(at("q"), FileMode::read);
  ASSERT_TRUE(r);
  EXPECT_FALSE(filecache_open(at("q"), FileMode::append));  // readers hold it
  filecache_close(r);

  // A rewrite in progress: a second one is refused, readers see the file on
  // disk, and the rewrite replaces it at close.
  put(at("m"), "old");
  CacheFile rw = filecache_open(at("m"), FileMode::write);
  ASSERT_TRUE(rw);
  EXPECT_FALSE(filecache_open(at("m"), FileMode::write));
  filecache_puts(rw, "new text");
  CacheFile reader = filecache_open(at("m"), FileMode::read);
  EXPECT_EQ(walk(reader), "old");
  ASSERT_EQ(filecache_close(rw), 0);
  EXPECT_EQ(walk(reader), "old");
  filecache_close(reader);
  CacheFile after = filecache_open(at("m"), FileMode::read);
  EXPECT_EQ(walk(after), "new text");
}

// Runs `body` in a child whose files may not grow past `bytes`, so a write
// fails the way it does on a full disk. The child's exit code is the result.
template <class F>
int with_file_size_limit(rlim_t bytes, F body) {
  std::fflush(stdout);
  pid_t pid = ::fork();
  if (pid == 0) {
    ::signal(SIGXFSZ, SIG_IGN);
    struct rlimit rl{bytes, bytes};
    ::setrlimit(RLIMIT_FSIZE, &rl);
    std::_Exit(body());
  }
  int status = 0;
  ::waitpid(pid, &status, 0);
  return WIFEXITED(status) ? WEXITSTATUS(status) : 100;
}

TEST_F(FileCacheTest, AFullDiskIsReportedAndTheOldFileKept) {
  const std::string old_text = "the file as it was\n";
  put(at("cfg"), old_text);
  const std::string big = pattern(300000);
  int rc = with_file_size_limit(64 * 1024, [&] {
    CacheFile w = filecache_open(at("cfg"), FileMode::write);
    if (!w) return 1;
    int err = filecache_write(w, big);  // the spill fails here or at close
    int close_err = err ? filecache_abandon(w) : filecache_close(w);
    if (err == 0 && close_err == 0) return 2;
    if (file_is_regular(at(".cfg.new"))) return 3;
    // Appends report it at the sync that a delivery makes.
    CacheFile a = filecache_open(at("mbox"), FileMode::append);
    if (!a) return 4;
    for (int i = 0; i < 10; ++i) filecache_write(a, big.substr(0, 10000));
    if (filecache_sync(a) != EFBIG) return 5;
    filecache_truncate(a, 0);
    return filecache_close(a) == 0 ? 0 : 6;
  });
  EXPECT_EQ(rc, 0);
  EXPECT_EQ(slurp(at("cfg")), old_text);
  EXPECT_EQ(file_size(at("mbox")), 0);

  // A process that dies in the middle of a rewrite leaves the old file too,
  // and the next rewrite takes over the leftover.
  rc = with_file_size_limit(1 << 30, [&] {
    CacheFile w = filecache_open(at("cfg"), FileMode::write);
    filecache_write(w, big);
    filecache_sync(w);
    std::_Exit(0);
    return 0;
  });
  EXPECT_EQ(slurp(at("cfg")), old_text);
  EXPECT_EQ(file_write_atomic(at("cfg"), "replaced\n", true, 0600), 0);
  EXPECT_EQ(slurp(at("cfg")), "replaced\n");
  EXPECT_EQ(slurp(at("cfg~")), old_text);
  struct stat st{};
  ASSERT_EQ(::stat(at("cfg").c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0600u);
  EXPECT_FALSE(file_is_regular(at(".cfg.new")));
}

// A rewrite is synced before its rename, and a failed sync or rename leaves
// the old file as it was.
TEST_F(FileCacheTest, ARewriteSyncsBeforeItsRenameAndKeepsTheOldFileOnFailure) {
  put(at("cfg"), "old\n");
  for (sysio::Op op : {sysio::Op::write, sysio::Op::sync, sysio::Op::rename}) {
    sysio::reset();
    sysio::fail_nth(op, 1);
    EXPECT_EQ(file_write_atomic(at("cfg"), "new\n"), EIO);
    EXPECT_EQ(slurp(at("cfg")), "old\n");
    EXPECT_FALSE(file_is_regular(at(".cfg.new")));
  }
  // A folder sync that fails after the rename is reported too: the caller
  // must not count on the new file surviving a crash.
  sysio::reset();
  sysio::fail_nth(sysio::Op::sync, 2);
  EXPECT_EQ(file_write_atomic(at("cfg"), "newer\n"), EIO);
  sysio::reset();
  EXPECT_EQ(file_write_atomic(at("cfg"), "new\n"), 0);
  EXPECT_EQ(slurp(at("cfg")), "new\n");
  EXPECT_EQ(sysio::count(sysio::Op::sync), 2u);  // the file, then its folder
  EXPECT_EQ(sysio::count(sysio::Op::rename), 1u);
}

TEST_F(FileCacheTest, TemporaryFilesLiveUntilTheirClose) {
  limit_file_size(16);
  CacheFile t = filecache_open("", FileMode::temporary);
  ASSERT_TRUE(t);
  std::string path = filecache_path(t);
  EXPECT_EQ(path_dir(path), paths.tmp_dir);
  EXPECT_TRUE(file_is_regular(path));
  const std::string text = pattern(50000);  // more than one buffer
  ASSERT_EQ(filecache_write(t, text), 0);
  EXPECT_EQ(walk(t), text);

  CacheFile copy = filecache_open("", FileMode::temporary);
  ASSERT_TRUE(copy);
  EXPECT_NE(filecache_path(copy), path);
  EXPECT_EQ(filecache_copy(t, 10, copy, 30000), 0);
  EXPECT_EQ(walk(copy), text.substr(10, 30000));
  EXPECT_EQ(filecache_close(t), 0);
  EXPECT_FALSE(file_is_regular(path));
  std::string copy_path = filecache_path(copy);
  filecache_close(copy);
  EXPECT_FALSE(file_is_regular(copy_path));

  std::string name = filecache_temp_name();
  EXPECT_EQ(path_dir(name), paths.tmp_dir);
  EXPECT_NE(filecache_temp_name(), name);
}

TEST_F(FileCacheTest, DeletingAndDroppingEntries) {
  put(at("d"), "doomed");
  CacheFile a = filecache_open(at("d"), FileMode::read);
  CacheFile b = filecache_open(at("d"), FileMode::read);
  EXPECT_EQ(filecache_destroy(a), 0);
  EXPECT_FALSE(file_is_regular(at("d")));
  EXPECT_EQ(walk(b), "doomed");  // the other holder keeps reading
  filecache_close(b);
  EXPECT_FALSE(filecache_open(at("d"), FileMode::read));

  put(at("e"), "x");
  CacheFile e = filecache_open(at("e"), FileMode::read);
  EXPECT_EQ(filecache_delete(at("e")), 0);
  EXPECT_EQ(filecache_delete(at("e")), ENOENT);
  filecache_close(e);

  // Closed handles and empty ones are refused without harm.
  CacheFile none;
  EXPECT_EQ(filecache_load(none, 0), 0u);
  EXPECT_EQ(filecache_write(none, "x"), EBADF);
  EXPECT_EQ(filecache_close(none), 0);
  EXPECT_TRUE(filecache_at_end(none, 0));
  EXPECT_EQ(filecache_copy(none, 0, none, 1), EBADF);
}

TEST_F(FileCacheTest, MemoryPressureNeverFreesAnEntryInUse) {
  config.cache_max = 40 * 1024;
  ASSERT_EQ(filecache_init(), 0);
  const std::string keep = pattern(30000);
  put(at("keep"), keep);
  CacheFile held = filecache_open(at("keep"), FileMode::read);
  ASSERT_TRUE(held);
  for (int i = 0; i < 50; ++i) {
    std::string p = at("f" + std::to_string(i));
    put(p, pattern(5000 + i));
    CacheFile f = filecache_open(p, FileMode::read);
    ASSERT_EQ(walk(f), pattern(5000 + i));
    filecache_close(f);
  }
  EXPECT_EQ(walk(held), keep);
  filecache_close(held);
}

TEST(FileHelpers, PathsAndFolders) {
  EXPECT_EQ(path_join("a/", "/b"), "a/b");
  EXPECT_EQ(path_join("/", "b"), "/b");
  EXPECT_EQ(path_join("", "b"), "b");
  EXPECT_EQ(path_join("a", "b/c"), "a/b/c");
  EXPECT_EQ(path_leaf("/x/y.tar.gz"), "y.tar.gz");
  EXPECT_EQ(path_leaf("plain"), "plain");
  EXPECT_EQ(path_extension("/x.d/y.tar.gz"), "gz");
  EXPECT_EQ(path_extension("/x.d/readme"), "");
  EXPECT_EQ(path_dir("/x/y"), "/x");
  EXPECT_EQ(path_dir("/y"), "/");
  EXPECT_EQ(path_dir("y"), "");

  testing_files::ScratchDir scratch;
  std::string base = scratch.path().string();
  make_parent_dirs(base + "/p/q/file");
  EXPECT_TRUE(file_is_directory(base + "/p/q"));
  EXPECT_FALSE(file_is_directory(base + "/p/q/file"));
  make_path(base + "/r/s/");
  EXPECT_TRUE(file_is_directory(base + "/r/s"));
  EXPECT_EQ(file_size(base + "/none"), -1);
  EXPECT_EQ(file_mtime(base + "/none"), 0);
  ASSERT_EQ(file_create(base + "/p/f"), 0);
  EXPECT_EQ(file_size(base + "/p/f"), 0);
  EXPECT_GT(file_mtime(base + "/p/f"), 0);
}

}  // namespace
}  // namespace velmor
