// The tarnaudiod process: start-up, the polling loop and the ordered
// shutdown (tarnaudiod.cpp), the control request handler (dispatch.cpp).
#ifndef TARN_TARNAUDIOD_H
#define TARN_TARNAUDIOD_H

#include <vector>

#include <json/json.h>

#include "daemon/ctrl_conns.h"
#include "daemon/tarn_types.h"

class LocalPlayer;
class UpnpController;
class UpnpPlayer;

// Everything main owns for the life of the process.
struct DaemonContext {
    int mplayerListenFd = -1;
    int ctrlListenFd = -1;
    UpnpController *controller = nullptr;
    LocalPlayer *localPlayer = nullptr;
    PlayerStatusShm *playerShm = nullptr;
    PublishedStatusShm *publishedShm = nullptr;
    std::vector<UpnpPlayer *> upnpPlayers;  // in order of creation
    ControlConnections conns;               // accepted control connections
};

// How often renderer players are polled while any exists (their own
// deadlines decide what each poll sends).
#define DAEMON_RENDERER_POLL_MS 100

// How long a renderer's player and queue are kept after it left the
// network; selected again within that time, it finds its queue.
#define DAEMON_RENDERER_KEEP_SECONDS (15 * 60)

// SIGTERM: clears the running flag and wakes the loop's wait.
void DaemonOnSigterm(int sig);

// SIGPIPE ignored, SIGTERM handled; 0 or -1.
int DaemonSetupSignals();

// Single-instance check (exits 0 when another daemon runs), daemon(), pid
// file, signals. 0 or -1.
int DaemonInit();

// Foreground: DaemonInit does not detach, every log message also goes to
// standard error, and SIGINT (Ctrl-C) stops the daemon like SIGTERM.
void DaemonSetForeground(int on);

// Sockets, controller, local player, segments, the two searches. 0 or -1
// (what was created stays in ctx for DaemonShutdown).
int DaemonStart(DaemonContext &ctx);

// One turn of the main loop: sleeps in one poll until a socket is ready, a
// deadline is due or a signal arrives; then accepts at most one
// mplayer-daemon connection, serves at most one control request, polls the
// players, writes the changed flag and publishes the selected player.
void DaemonLoopTurn(DaemonContext &ctx);

// Releases everything in order, removes the pid file. Returns 0.
int DaemonShutdown(DaemonContext &ctx);

// The whole process: init, start, loop, shutdown. Returns 0.
int DaemonRun();

// Serves one control connection: reads one request (waiting at most 0.5 s),
// dispatches it, writes the 8192-byte reply (waiting at most 0.5 s) and
// closes fd. Always returns -1 (callers ignore it).
int HandleRequest(int fd, LocalPlayer *localPlayer, UpnpController *controller,
                  std::vector<UpnpPlayer *> &upnpPlayers);

// Serves the ready connection fd of ctx.conns: one read of the request (a
// short one closes the connection), dispatch, and the reply handed to
// ctx.conns to write.
void ServeRequest(DaemonContext &ctx, int fd);

// The renderer player whose renderer has the index, or nullptr.
UpnpPlayer *FindPlayerByIndex(std::vector<UpnpPlayer *> &players, int index);

// The reply text as sent: the JSON text (platform/json_text.h) cut to 8191
// characters by whole entries of a page or list, and
// NUL-terminated in an 8192-byte buffer.
void FormatReply(const Json::Value &reply, char buffer[CTRL_REPLY_SIZE]);

// The reply text of one request into out: the daemon's own actions, the
// source changes, or the selected player's (a queue page is written straight
// from its queue, the same text its JSON value would give).
void AnswerRequest(const ControlRequest *request, char out[CTRL_REPLY_SIZE], LocalPlayer *localPlayer,
                   UpnpController *controller, std::vector<UpnpPlayer *> &upnpPlayers);

#endif
