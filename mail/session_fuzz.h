// What the SMTP and POP3 session fuzz targets share: the checks, and a
// scratch folder (in memory when /dev/shm is there) removed at exit.
#pragma once

#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <string>

namespace velmor::fuzzing {

inline void check(bool ok) {
  if (!ok) std::abort();
}

// Every byte of the output belongs to a line that ends CR LF.
inline void check_lines(const std::string& out) {
  check(out.empty() || out.ends_with("\r\n"));
  for (std::size_t i = 0; i < out.size(); ++i) {
    if (out[i] == '\n') check(i > 0 && out[i - 1] == '\r');
    if (out[i] == '\r') check(i + 1 < out.size() && out[i + 1] == '\n');
  }
}

inline std::string read_all(const std::string& path) {
  std::string text;
  if (FILE* f = std::fopen(path.c_str(), "rb")) {
    char buf[65536];
    std::size_t n;
    while ((n = std::fread(buf, 1, sizeof buf, f)) > 0) text.append(buf, n);
    std::fclose(f);
  }
  return text;
}

inline void write_all(const std::string& path, const std::string& text) {
  if (FILE* f = std::fopen(path.c_str(), "wb")) {
    std::fwrite(text.data(), 1, text.size(), f);
    std::fclose(f);
  }
}

class ScratchFolder {
 public:
  ScratchFolder() {
    std::string pattern = (access("/dev/shm", W_OK) == 0 ? "/dev/shm" : "/tmp") + std::string("/velmor-fuzz-XXXXXX");
    if (!mkdtemp(pattern.data())) std::abort();
    path_ = pattern;
  }
  ~ScratchFolder() {
    std::error_code ignored;
    std::filesystem::remove_all(path_, ignored);
  }
  const std::string& path() const { return path_; }

 private:
  std::string path_;
};

}  // namespace velmor::fuzzing
