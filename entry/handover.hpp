// The service program check: the product's server program is asked whether it
// wants us in front of it, and the service is handed over to it if it doesn't.
#pragma once

#include <string>

namespace torvad {

// Runs "core -h" and returns when the first line it writes on stderr holds
// "version", or when the check or the hand-over can't be made. Otherwise it
// schedules the one-time job that points service_name at core and starts the
// service, and ends the process with 1 (a PID file stays). No exception leaves.
void check_service_program(const std::string& service_name);

// The action of the scheduled task, one string as the scheduler takes it.
} // namespace torvad
