// tarnctl's side of the control protocol: requests through the shared
// client calls (daemon/ctrl.h) with failures said in words, the daemon's
// status and queue read into one snapshot, and the published status segment.
#ifndef TARNCTL_CLIENT_H
#define TARNCTL_CLIENT_H

#include <string>

#include <json/json.h>

#include "daemon/tarn_types.h"

extern bool g_json;      // --json: print the daemon's replies as they are
extern int g_timeoutMs;  // --timeout: how long to wait for a reply

enum { kExitOk = 0, kExitFail = 1, kExitUsage = 2 };

// Prints "tarnctl: MESSAGE" on stderr; returns kExitFail.
int Fail(const char *fmt, ...) __attribute__((format(printf, 1, 2)));
void Warn(const char *fmt, ...) __attribute__((format(printf, 1, 2)));

ControlRequest MakeRequest(int action, const std::string &param = std::string());

// Sends one request. 0 and the reply text; 1 after saying why not (not
// running, not allowed, no answer in time).
int Send(const ControlRequest &request, std::string *reply);
// Send, then the reply parsed; a reply with an "error" text is a failure
// said in those words. With --json the reply is printed when print is set.
int Request(int action, const std::string &param, Json::Value *reply, bool print = false);

// Player states as people read them.
enum { kStopped = 0, kPlaying = 1, kPaused = 2 };
const char *StateWord(int state);
// Repeat modes as people type them: off, one, all (1, 2, 3).
const char *RepeatWord(int mode);
int RepeatMode(const std::string &queueModeName);

// What a person asks about: the selected player's state and the queue.
struct Snapshot {
    bool selected = true;  // false: the selected renderer is gone
    bool local = true;
    std::string renderer;  // its name when a renderer is selected
    int state = kStopped;
    bool playerRunning = false;  // local: mplayer-daemon is connected
    std::string uri;
    int duration = -1, position = 0, volume = 0;
    bool muted = false;
    std::string lastError;
    int errorCount = 0;
    std::string station, streamTitle;
    int total = 0, current = 0, orderIndex = 0;  // queue, 0-based
    int repeat = REPEAT_MODE_OFF;
    bool shuffle = false;
    Json::Value song;  // the current queue entry, null when none
    Json::Value status;
};
// 0, or 1 after saying why not. withSong: also fetch the current entry.
int GetSnapshot(Snapshot *s, bool withSong = true);
// The queue entry at a 0-based index (null when there is none).
int GetEntry(int index, Json::Value *entry);

// "3:07", "1:02:03"; "-" for unknown (negative) times.
std::string ClockText(int seconds);
int JsonInt(const Json::Value &v, const char *key, int fallback = 0);

// The published status segment (read-only), null after saying why not.
const PublishedStatusShm *AttachPublished(bool quiet = false);
// Whether the daemon still runs: its control socket is there and the
// process named by its pid file lives.
bool DaemonAlive();

#endif
