// Shell commands run without blocking the suite: started through /bin/sh,
// reaped by the main loop when they end, with a callback for the exit status.
// Children inherit no descriptor of the suite (everything is close-on-exec).
#pragma once

#include <functional>
#include <string>

namespace velmor {

// Starts `command` with /bin/sh -c. `done` (optional) gets the wait status
// when the child ends (-1 when it could not be reaped). Returns the child's
// pid, or -1 when it could not be started.
int run_shell(const std::string& command, std::function<void(int status)> done = {});
// Reaps ended children and runs their callbacks; called every tick.
void process_poll();

}  // namespace velmor
