// The modem dialler: brings the link up on demand by running a dialler script
// (dialler/script.h) against a modem on a serial port, watches the carrier
// and the link, and hangs up. One instance; driven by the main loop, one
// script step or one modem check per pass, never waiting on the port.
//
// States: 0 idle; 1 script complete (on line, the link monitor decides
// whether the link is up); 2 running the script; 4 waiting for the modem's
// OK; 5 dialling; 7 waiting for a text; 10 waiting to redial; 11 pausing.
#pragma once

#include <cstdint>
#include <functional>
#include <string>

namespace velmor {

// Start-up: fills hooks.dial, hooks.disconnect, hooks.link_watch and
// hooks.dialler_busy. 0.
int dialler_init();
// Main loop, every tick: finishes a serial-port reset that is due, runs the
// link watch, checks the carrier while on line and advances the script.
void dialler_poll();
// Shutdown: hangs up; the port is closed with DTR down.
void dialler_shutdown();

// Opens and configures dialler.driver and starts dialler.script (only while
// idle, and only a script while the link is down). A device that cannot be
// opened is printed and logged, and the dialler stays idle.
void dial();
// Hangs up from any state and returns to idle. While on line it logs how long
// and runs dialler.discmd.
void disconnect();
// Hangs up when the link has stayed down for more than dialler.linktime
// seconds while the dialler is on line or running its script (not while it
// dials). Runs on every dialler poll; the link monitor may run it too.
void link_watch();

int dialler_state();
// The status pages' one-line description of the dialler.
std::string dialler_status_text();

// ---- the test seam ----------------------------------------------------------
// The modem-control requests (TIOCMGET/TIOCMSET, -1 with errno on failure)
// and the millisecond clock of the port reset. Members left empty use the
// real calls.
struct DiallerSeam {
  std::function<int(int fd, int* bits)> get_lines;
  std::function<int(int fd, int bits)> set_lines;
  std::function<std::int64_t()> clock_ms;
};
void dialler_set_seam(DiallerSeam seam);

}  // namespace velmor
