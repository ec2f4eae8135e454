// The service path: the daemon run under the service manager.
#pragma once

namespace torvad {

// Reports start, runs the loop until a stop control or the last persistent
// child's end, stops the children and gives them a second run to end in.
void run_service();

// The stop and shutdown controls: only make the first run of the loop return.
void service_control_stop();

} // namespace torvad
