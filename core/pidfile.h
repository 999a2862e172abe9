// The pid file, held with flock() for as long as the suite runs. A second
// instance finds it locked and is refused; a file left behind by a suite
// that died (nobody holds its lock any more) is simply replaced, so a crash
// never needs a hand to clean up. The lock belongs to the open file, so it
// stays held when the suite gives root up.
#pragma once

#include <sys/types.h>

#include <string>

#include "core/fileio.h"

namespace velmor {

class PidFile {
 public:
  enum class Claim {
    free,     // no file there (or something that is not a file, such as a folder)
    stale,    // a file nobody holds: its lock is ours now, stale_pid() says what it held
    running,  // another process holds the file's lock
    failed,   // the file cannot be opened to test its lock (error() says why)
  };

  // Looks at `path`. Called first thing at start-up, as whoever starts the
  // suite, so that a second instance stops before it touches anything.
  Claim claim(const std::string& path);

  // Writes `pid` into a new file that is locked before it is renamed over
  // the path, so the path always names a locked file, or none. `running`
  // when another instance published its file since claim() found none;
  // `failed` when the file cannot be written (the suite then runs without
  // one; error() says why); otherwise `free` (or `stale` when a dead
  // instance's file was replaced).
  Claim publish(pid_t pid);

  // Removes the file when it is still the one published, and lets go.
  void remove();

  const std::string& path() const { return path_; }
  // What the replaced file held (trimmed; at most 32 characters).
  const std::string& stale_pid() const { return stale_; }
  bool replaced_stale() const { return replaced_stale_; }
  const std::string& error() const { return error_; }
  bool published() const { return published_; }

 private:
  // Opens the file at path_ and tries its lock; on `stale`, held_ has it.
  Claim test_lock();

  std::string path_;
  UniqueFd held_;
  std::string stale_;
  std::string error_;
  bool replaced_stale_ = false;
  bool published_ = false;
};

}  // namespace velmor
