// Run environment of the daemon and its tools.
//
// Every fixed file path and shared-memory key the system uses keeps its
// appliance value by default. A few environment variables move them so that
// many daemons can run side by side (tests, benchmarks, demos):
//   TARN_ROOT      directory that every fixed path is placed under
//   TARN_SHM_KEY   player status segment key (the published one is key + 1)
//   TARN_LOG_FILE  every log line is appended there as well as to syslog
//   TARN_AUDIO_OUT mplayer-daemon's output: "default", "null" or "wav:PATH"
// This module is the only place that reads the environment.
#ifndef TARN_ENV_H
#define TARN_ENV_H

#include <string>

// Fixed paths (placed under TARN_ROOT by TarnPath()).
#define TARN_CTRL_SOCKET "/tmp/tarnaudiod.sock"
#define TARN_MPLAYER_SOCKET "/tmp/mplayer.sock"
#define TARN_PID_FILE "/var/run/tarnaudiod.pid"
#define TARN_MPLAYER_PID_FILE "/var/run/mplayer.daemon.pid"
#define TARN_MPLAYER_BIN "/usr/tarn/bin/mplayer-daemon"
#define TARN_INFO_CONF "/etc/tarninfo.conf"

// The fixed path placed under TARN_ROOT when that is set ("/tmp/x" ->
// "<root>/tmp/x"); unchanged otherwise.
std::string TarnPath(const char *fixedPath);

// TARN_ROOT, or "" when unset.
const std::string &TarnRoot();

// Player status segment key (25521815 by default) and published status
// segment key (the player key + 1, 25521816 by default).
int TarnShmKeyPlayer();
int TarnShmKeyPublished();

// TARN_LOG_FILE, or "" when unset.
const std::string &TarnLogFile();

// TARN_AUDIO_OUT, "default" when unset.
const std::string &TarnAudioOut();

// Any other setting of the tools (e.g. the GStreamer registry location);
// "" when unset. Kept here so that the environment is read in one place.
std::string TarnEnvGet(const char *name);

#endif
