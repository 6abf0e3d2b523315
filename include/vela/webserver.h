// Web-server control of the platform: the graceful restart the front end
// asks for after a reply (for example after the server's configuration
// changed).
//
// Configuration, in /etc/vela/webapi.conf under the system root:
//   httpd_name="lighttpd"              process name of the server, as the
//                                      kernel shows it (/proc/<pid>/comm:
//                                      1 to 15 letters, digits, ".", "_", "-")
//   httpd_pidfile="/run/lighttpd.pid"  its pid file, resolved under the root
//   httpd_restart_signal="USR1"        HUP, USR1 or USR2: the server's
//                                      graceful restart (USR1 for lighttpd)
// The values shown are the defaults.
#pragma once

#include <string>

#include "vela/export.h"

// Exported from libwebapi-TARN5.so, whose other symbols are hidden.
#pragma GCC visibility push(default)

namespace velaw3 {

// The web server the machine runs, as the configuration describes it. The
// configuration is read by the constructor.
class VELA_EXPORT Engine {
public:
    Engine();

    // False when the configuration file is corrupt or holds a value that
    // cannot be used (the reason is logged); such an engine is never
    // signalled.
    bool IsValid() const { return valid_; }
    const std::string& GetName() const { return name_; }
    // The resolved pid-file path.
    const std::string& GetPidFile() const { return pidFile_; }
    int GetRestartSignal() const { return restartSignal_; }

private:
    bool valid_;
    std::string name_;
    std::string pidFile_;
    int restartSignal_;
};

class VELA_EXPORT TARN {
public:
    explicit TARN(Engine& engine);

    // Sends the engine's restart signal to the server. The pid file must be
    // a regular file (not a symbolic link) owned by root or by this
    // process's user and writable by nobody else, holding one pid above 1;
    // that process must exist and carry the configured name. Anything else
    // refuses (false, one log line) and no signal is sent. The signal goes
    // through a pidfd where the kernel has them, so a pid reused after the
    // check is never signalled.
    bool RestartService();

private:
    Engine& engine_;
};

}  // namespace velaw3

#pragma GCC visibility pop
