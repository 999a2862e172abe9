// The one fixture every unit test that touches process-wide state derives
// from: each test starts from the built-in configuration, default paths, a
// clear loop (no services, connections, hooks or resolver), empty hooks, the
// file seam reset, and the process words at their start values; and leaves
// nothing open behind it.
#pragma once

#include <gtest/gtest.h>

#include <ctime>

#include "core/config.h"
#include "core/fileio.h"
#include "core/globals.h"
#include "core/hooks.h"
#include "core/network.h"

namespace velmor {

inline void reset_process_state() {
  net_reset();
  config_reset();
  paths = SuitePaths{};
  hooks = SuiteHooks{};
  sysio::reset();
  server_now = std::time(nullptr);
  mail_transfer_state = 0;
  link_up = 0;
  link_probe_due = 0;
  log_mask = 0;
  status_bits = 0;
  quit_flag = 0;
}

class SuiteTest : public ::testing::Test {
 protected:
  void SetUp() override { reset_process_state(); }
  void TearDown() override { reset_process_state(); }
};

}  // namespace velmor
