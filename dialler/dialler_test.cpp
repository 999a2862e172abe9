#include "dialler/dialler.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/ioctl.h>
#include <unistd.h>

#include <filesystem>
#include <string>

#include "core/commands.h"
#include "core/config.h"
#include "core/filecache.h"
#include "core/globals.h"
#include "core/hooks.h"
#include "core/log.h"
#include "core/test_files.h"

namespace velmor {
namespace {

using testing_files::read_file;
using testing_files::write_file;

// The dialler against a pseudo-terminal whose master side plays the modem.
class DiallerTest : public ::testing::Test {
 protected:
  void SetUp() override {
    dir_ = scratch_.path().string();
    paths.tmp_dir = dir_ + "/tmp";
    config_reset();
    filecache_init();
    write_file(dir_ + "/logs", "2 " + dir_ + "/main 1\n13 " + dir_ + "/dialler 1\n");
    config.file_log_master = dir_ + "/logs";
    ASSERT_EQ(log_init(), 0);
    log_mask = logfac::house | logfac::dialler;
    server_now = 1000000;
    link_up = 0;
    master_ = posix_openpt(O_RDWR | O_NOCTTY | O_NONBLOCK);
    ASSERT_GE(master_, 0);
    ASSERT_EQ(grantpt(master_), 0);
    ASSERT_EQ(unlockpt(master_), 0);
    slave_ = ptsname(master_);
    config.dialler_driver = slave_;
    config.dialler_script = dir_ + "/script";
    dialler_init();
  }
  void TearDown() override {
    dialler_shutdown();
    dialler_set_seam({});
    if (master_ >= 0) close(master_);
    hooks = SuiteHooks{};
    link_up = 0;
    mail_transfer_state = 0;
    log_reset();
    filecache_shutdown();
    config_reset();
  }
  void script(const std::string& text) { write_file(dir_ + "/script", text); }
  void modem_says(const std::string& text) { ASSERT_EQ(write(master_, text.data(), text.size()), ssize_t(text.size())); }
  std::string modem_heard() {
    std::string out;
    char buf[256];
    for (ssize_t n; (n = read(master_, buf, sizeof buf)) > 0;) out.append(buf, static_cast<std::size_t>(n));
    return out;
  }
  void polls(int n) {
    for (int i = 0; i < n; ++i) dialler_poll();
  }
  std::string main_log() { return read_file(dir_ + "/main"); }
  // A device with real modem lines, and a clock the test moves.
  void fake_lines() {
    DiallerSeam seam;
    seam.get_lines = [this](int, int* bits) { return *bits = lines_, 0; };
    seam.set_lines = [this](int, int bits) { return lines_ = bits, 0; };
    seam.clock_ms = [this] { return clock_ms_; };
    dialler_set_seam(seam);
  }

  testing_files::ScratchDir scratch_;
  std::string dir_, slave_;
  int master_ = -1;
  int lines_ = TIOCM_DTR | TIOCM_RTS;
  std::int64_t clock_ms_ = 0;
};

TEST_F(DiallerTest, ResetHoldsDtrDownAcrossPollsWhileTheScriptWaits) {
  fake_lines();
  script("i ATZ\nm\ns hello\n");
  dial();
  EXPECT_FALSE(lines_ & TIOCM_DTR);
  clock_ms_ += 499;
  polls(2);
  EXPECT_FALSE(lines_ & TIOCM_DTR);
  EXPECT_EQ(modem_heard(), "");
  clock_ms_ += 1;
  dialler_poll();
  EXPECT_TRUE(lines_ & TIOCM_DTR);
  EXPECT_EQ(modem_heard(), "ATZ\r");
  modem_says("ATZ\r\r\nOK\r\n");  // echo and OK in one read
  polls(2);                       // OK; then "m" drops DTR again
  EXPECT_FALSE(lines_ & TIOCM_DTR);
  polls(2);
  EXPECT_EQ(modem_heard(), "");
  clock_ms_ += 500;
  polls(2);
  EXPECT_EQ(modem_heard(), "hello\r");
  // A carrier that drops while on line hangs up.
  script("d ATDT1\n");
  disconnect();
  clock_ms_ += 500;
  dial();
  clock_ms_ += 500;
  polls(2);
  modem_says("CONNECT\r\n");
  lines_ |= TIOCM_CAR;
  polls(3);
  EXPECT_EQ(dialler_state(), 1);
  lines_ &= ~TIOCM_CAR;
  dialler_poll();
  EXPECT_EQ(dialler_state(), 0);
  EXPECT_NE(main_log().find("Modem has hung up - dialler going idle.\n"), std::string::npos);
}

TEST_F(DiallerTest, PseudoTerminalStaysOnLineAndHoldsNoDescriptorAcrossExec) {
  script("d \"ATDT%phone\"\n");
  config.dialler_phone = "5551234";
  dial();
  dialler_poll();
  EXPECT_EQ(modem_heard(), "ATDT5551234\r");
  EXPECT_EQ(dialler_status_text(), "Dialling number");
  modem_says("\r\nCONNECT 115200\r\n");
  polls(6);
  EXPECT_EQ(dialler_status_text(), "Dialler connected [115200]: No Link");
  std::string log = main_log();
  const std::string note = "Modem-control lines not available";
  ASSERT_NE(log.find(note), std::string::npos);
  EXPECT_EQ(log.find(note), log.rfind(note));

  bool found = false;
  for (const auto& entry : std::filesystem::directory_iterator("/proc/self/fd")) {
    std::error_code ec;
    if (std::filesystem::read_symlink(entry.path(), ec) != slave_) continue;
    found = true;
    int fd = std::stoi(entry.path().filename().string());
    EXPECT_TRUE(fcntl(fd, F_GETFD) & FD_CLOEXEC);
  }
  EXPECT_TRUE(found);
}

TEST_F(DiallerTest, ShellCommandsAreLoggedAsWrittenAndNeverCutShort) {
  config.dialler_pass = "Sekrit-1";
  script("c true %pass\nc true " + std::string(250, 'x') + "\n");
  dial();
  polls(3);
  EXPECT_EQ(dialler_state(), 1);
  std::string log = main_log();
  EXPECT_NE(log.find("Executing string: true %pass\n"), std::string::npos);
  EXPECT_EQ(log.find("Sekrit-1"), std::string::npos);
  EXPECT_NE(log.find("Refusing shell command: longer than 250 characters\n"), std::string::npos);
}

TEST_F(DiallerTest, LinkWatchHangsUpAStuckScript) {
  config.dialler_linktime = 5;
  script("i ATZ\n");
  dial();
  polls(2);
  EXPECT_EQ(dialler_state(), 4);  // the modem never answers
  server_now += 5;
  dialler_poll();
  EXPECT_EQ(dialler_state(), 4);
  server_now += 1;
  dialler_poll();
  EXPECT_EQ(dialler_state(), 0);
  EXPECT_NE(main_log().find("Resetting modem.\n"), std::string::npos);
}

TEST_F(DiallerTest, TheEndOfAMailTransferHangsUp) {
  script("d ATDT1\n");
  dial();
  dialler_poll();
  modem_says("CONNECT 9600\r\n");
  polls(3);
  ASSERT_EQ(dialler_state(), 1);
  link_up = 1;  // whoever proves the link
  mail_transfer_state = 5;
  mail_transfer_poll();
  server_now += 60;  // no client had anything to do
  mail_transfer_poll();
  mail_transfer_poll();
  EXPECT_EQ(mail_transfer_state, 0);
  EXPECT_EQ(dialler_state(), 0);
  EXPECT_EQ(link_up, 0);
  EXPECT_EQ(link_probe_due, 1);
  EXPECT_NE(read_file(dir_ + "/dialler").find("Disconnecting. Online for 1 minute, 0 seconds.\n"),
            std::string::npos);
}

TEST_F(DiallerTest, ADeviceThatCannotBeOpenedIsLogged) {
  config.dialler_driver = dir_ + "/no-such-tty";
  dial();
  EXPECT_EQ(dialler_state(), 0);
  EXPECT_NE(main_log().find("Serial driver (" + dir_ + "/no-such-tty) open failed:No such file or directory"),
            std::string::npos);
}

}  // namespace
}  // namespace velmor
