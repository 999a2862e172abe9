// The control channel: a local datagram socket through which local tools
// (velmorctl) run internal commands, reload configuration, users and groups,
// switch log facilities, change a password and read the queues and status.
#pragma once

#include <functional>
#include <string>
#include <string_view>

namespace velmor {

// Creates and binds the socket at paths.control and has the loop call it
// when a request is waiting. 0 = done; 1 = it failed (logged), and the suite
// must not start: a path someone else holds would otherwise receive what
// local tools send.
int control_open();
// Closes the socket and removes its path (only when this process made it).
void control_remove();
// Handles one command text; every reply datagram goes to `reply`.
void control_command(std::string_view text, const std::function<void(std::string_view)>& reply);

}  // namespace velmor
