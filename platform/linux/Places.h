#pragma once

#include <string>

namespace ostrel {

// Where the service keeps its things, without a slash at the end. Each is the
// directory that systemd names in the environment, else the system's place for
// root, else the user's by the XDG conventions. None is made here.

/// `$RUNTIME_DIRECTORY`, "/run/ostrel", `$XDG_RUNTIME_DIR` + "/ostrel"
/// ("/tmp/ostrel-UID" where that is not set).
std::string runtimeDirectory();

/// `$STATE_DIRECTORY`, "/var/lib/ostrel",
/// `${XDG_STATE_HOME:-$HOME/.local/state}` + "/ostrel".
std::string stateDirectory();

/// `$LOGS_DIRECTORY`, "/var/log/ostrel", the state directory + "/log".
std::string diagnosticLogRoot();

/// The runtime directory + "/reporting.sock".
std::string reportingSocketPath();

/// The state directory + "/reports.db".
std::string storePath();

}  // namespace ostrel
