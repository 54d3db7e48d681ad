// Unix sockets of the daemon's services: the listening ones systemd hands
// over (socket activation), the ones the daemon binds itself, and the
// client's end.
//
// A unit may hand over several sockets; each service takes its own by the
// path it is bound to, so the order of the unit's Listen lines does not
// matter. The environment is left in place (LISTEN_PID keeps children from
// taking the sockets) so that every service can look.
#pragma once

#include <sys/types.h>

#include <string>

namespace tarn {

// The handed-over listening Unix socket of `type` bound to `path`, made
// close-on-exec and non-blocking, or -1 when none was handed over. Each
// socket is given out once.
int TakeActivatedSocket(const std::string& path, int type);

// A new non-blocking, close-on-exec listening Unix socket of `type` bound to
// `path` with `mode`; the parent directories are made. A stale socket left
// at the path by an earlier run is replaced, a live one (or any other file)
// is not. -1 with a reason on failure.
int BindListeningSocket(const std::string& path, int type, mode_t mode, std::string* why);

// A blocking, close-on-exec Unix socket of `type` connected to `path`; -1
// with a reason on failure.
int ConnectUnixSocket(const std::string& path, int type, std::string* why);

}  // namespace tarn
