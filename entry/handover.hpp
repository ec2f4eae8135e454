// The service program check: the product's server program is asked whether it
// wants us in front of it, and the service is handed over to it if it doesn't.
#pragma once

#include <string>

namespace torvad {

// Runs "core -h": when the first line it writes on stderr holds "version", or
// when the check or the hand-over can't be made, the start goes on. Otherwise
// it schedules the one-time job that points service_name at core and starts
// the service, and says the service is handed over: the run then ends with 1,
// its PID file left in place. No exception leaves.
enum class service_check { go_on, handed_over };
service_check check_service_program(const std::string& service_name);
} // namespace torvad
