// The file cache against plain read(2) on the same files:
//   CacheHit       open + close of a small file the cache already holds;
//   WindowedRead   a 10 MB file walked view by view at absolute offsets;
//   PlainRead      the same file read(2) through a 64 KB buffer.
#include <fcntl.h>
#include <ftw.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <string>
#include <vector>

#include <benchmark/benchmark.h>

#include "core/config.h"
#include "core/filecache.h"
#include "core/globals.h"

namespace {

using namespace velmor;

constexpr std::size_t kBigFile = 10 * 1024 * 1024;

struct Files {
  std::string dir, small, big;
  Files() {
    const char* base = std::getenv("TMPDIR");
    std::string tmpl = std::string(base && *base ? base : "/tmp") + "/velmor-bench-XXXXXX";
    if (!::mkdtemp(tmpl.data())) std::abort();
    dir = tmpl;
    paths.tmp_dir = dir + "/tmp";
    if (filecache_init() != 0) std::abort();
    small = dir + "/page.html";
    big = dir + "/big";
    make(small, 4096);
    make(big, kBigFile);
  }
  ~Files() {
    ::nftw(dir.c_str(), [](const char* p, const struct stat*, int, FTW*) { return ::remove(p); }, 8,
           FTW_DEPTH | FTW_PHYS);
  }
  // A file last changed an hour ago, like the templates and pages a server
  // reads again and again.
  static void make(const std::string& path, std::size_t size) {
    std::string data(size, '\0');
    for (std::size_t i = 0; i < size; ++i) data[i] = static_cast<char>('a' + i % 26);
    int fd = ::open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
    if (fd < 0 || ::write(fd, data.data(), size) != static_cast<ssize_t>(size)) std::abort();
    timespec old[2] = {{::time(nullptr) - 3600, 0}, {::time(nullptr) - 3600, 0}};
    ::futimens(fd, old);
    ::close(fd);
  }
};

Files& files() {
  static Files f;
  return f;
}

void CacheHit(benchmark::State& state) {
  const std::string& path = files().small;
  for (auto _ : state) {
    CacheFile f = filecache_open(path, FileMode::read);
    benchmark::DoNotOptimize(filecache_view(f, 0).data());
    filecache_close(f);
  }
}
BENCHMARK(CacheHit);

void WindowedRead(benchmark::State& state) {
  const std::string& path = files().big;
  for (auto _ : state) {
    CacheFile f = filecache_open(path, FileMode::read);
    std::uint64_t pos = 0;
    for (std::string_view v; !(v = filecache_view(f, pos)).empty(); pos += v.size()) benchmark::DoNotOptimize(v.data());
    if (pos != kBigFile) state.SkipWithError("short read");
    filecache_close(f);
  }
  state.SetBytesProcessed(static_cast<std::int64_t>(state.iterations() * kBigFile));
}
BENCHMARK(WindowedRead)->Unit(benchmark::kMicrosecond);

void PlainRead(benchmark::State& state) {
  const std::string& path = files().big;
  std::vector<char> buf(64 * 1024);
  for (auto _ : state) {
    int fd = ::open(path.c_str(), O_RDONLY);
    std::size_t total = 0;
    for (ssize_t n; (n = ::read(fd, buf.data(), buf.size())) > 0; total += static_cast<std::size_t>(n))
      benchmark::DoNotOptimize(buf.data());
    ::close(fd);
    if (total != kBigFile) state.SkipWithError("short read");
  }
  state.SetBytesProcessed(static_cast<std::int64_t>(state.iterations() * kBigFile));
}
BENCHMARK(PlainRead)->Unit(benchmark::kMicrosecond);

}  // namespace

BENCHMARK_MAIN();
