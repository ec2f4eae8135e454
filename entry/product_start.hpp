// The product's start, chosen by what stands in the working directory: the
// server family ("core") or the web service ("wfe"). Each makes its one
// top-level child and configures the daemon; nothing is launched yet.
#pragma once

#include <string>

namespace torvad {

class daemon;

// Asks core whether to stay in front of it, runs the init script for core's
// account, and names the service family + "Server". False when the service
// was handed over to core instead: nothing is made, and the run ends.
// No exception leaves it but those of process::create and daemon::configure.
bool start_server_family(daemon& supervisor, const std::string& family);

// wfe under the local service account, service "WebService", no patterns file.
void start_web_service(daemon& supervisor);

} // namespace torvad
