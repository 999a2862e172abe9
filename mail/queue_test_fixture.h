// The scratch installation the queue and debatch tests run in: the three
// queue folders, the file cache and the mail keys of the configuration.
#pragma once

#include <dirent.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <algorithm>
#include <string>
#include <vector>

#include "core/config.h"
#include "core/filecache.h"
#include "core/globals.h"
#include "mail/queue.h"
#include "mail/queue_internal.h"
#include "core/test_files.h"
#include "core/test_fixture.h"

namespace velmor {

using testing_files::read_file;
using testing_files::write_file;

// The names in a folder, sorted; `numbered_only` keeps queue files alone.
inline std::vector<std::string> folder_names(const std::string& dir, bool numbered_only = false) {
  std::vector<std::string> names;
  if (DIR* d = opendir(dir.c_str())) {
    while (dirent* e = readdir(d)) {
      std::string n = e->d_name;
      if (n == "." || n == "..") continue;
      if (numbered_only && !(n[0] >= '0' && n[0] <= '9')) continue;
      names.push_back(numbered_only ? dir + "/" + n : n);
    }
    closedir(d);
  }
  std::sort(names.begin(), names.end());
  return names;
}

class QueueFixture : public SuiteTest {
 protected:
  void SetUp() override {
    SuiteTest::SetUp();
    root = scratch.path().string();
    paths.tmp_dir = root + "/tmp";
    filecache_init();
    config.mail_dir_incoming = root + "/in";
    config.mail_dir_outgoing = root + "/out";
    config.mail_dir_oddments = root + "/odd";
    config.mail_domains = "site.example, localhost";
    config.admin_email = "postmaster@site.example";
    mkdir((root + "/in").c_str(), 0770);
    mkdir((root + "/out").c_str(), 0770);
    queue_init(1000);
    queue_scan_incoming();
    queue_scan_outgoing();
  }
  void TearDown() override {
    filecache_shutdown();
    SuiteTest::TearDown();
  }
  std::string in(const std::string& n) { return root + "/in/" + n; }

  testing_files::ScratchDir scratch;
  std::string root;
};

}  // namespace velmor
