// tarnctl's commands and the helpers they share. The commands live in
// groups: playback (cmd_playback.cpp), queue (cmd_queue.cpp), library
// (cmd_library.cpp), sources, slots and players (cmd_sources.cpp), waiting
// and watching (cmd_watch.cpp); the shared helpers, status texts and
// read-back in cmd_common.cpp; the command table and main in tarnctl.cpp.
#ifndef TARNCTL_COMMANDS_H
#define TARNCTL_COMMANDS_H

#include <csignal>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include <json/json.h>

#include "daemon/tarn_types.h"
#include "tools/tarnctl/client.h"

namespace tarnctl {

using Args = std::vector<std::string>;

struct Command {
    const char *name;
    const char *args;     // the usage line after "tarnctl NAME"
    const char *summary;  // one line for the list
    const char *details;  // for "tarnctl help NAME"
    int (*run)(const Command &, Args &);
};

const int kSlotMax = 9;
extern volatile sig_atomic_t g_stop;
extern volatile sig_atomic_t g_resized;

// ---- shared helpers (cmd_common.cpp) ----
int UsageError(const Command &c, const char *fmt = nullptr, const char *arg = "");
long long NowMs();
void SleepMs(int ms);
bool ParseInt(const std::string &s, long *out);
// Removes "--name VALUE" (or a bare "--name" when value is null) from args.
int TakeOption(Args &args, const char *name, std::string *value, bool *present = nullptr);
bool HasOptionLeft(const Args &args, std::string *which);
int TerminalColumns();
// A local file that is gone: why, else "".
std::string MissingFile(const std::string &uri);
std::string Field(const Snapshot &s, const std::string &name, bool *known);
// The fields a --format text may name.
extern const char kFormatFields[];

// Expands a --format text; -1 with *bad set for an unknown field.
int Expand(const Snapshot &s, const std::string &fmt, std::string *out, std::string *bad);
void PrintStatus(const Snapshot &s);
// Prints the status after a playback command (nothing with --json).
int ShowAfter();
// Polls the snapshot until done(s) says yes; false after ms.
bool WaitFor(const std::function<bool(const Snapshot &)> &done, int ms, Snapshot *last);
// After a request that starts a song: it plays, or the error that stopped it.
int CheckStarted(int errorsBefore, int expectIndex, const std::string &expectUri);

// ---- playback (cmd_playback.cpp) ----
int CheckIndex(const Snapshot &s, long pos);
int CmdPlay(const Command &c, Args &a);
int CmdPause(const Command &c, Args &a);
int CmdToggle(const Command &c, Args &a);
int CmdStop(const Command &c, Args &a);
int CmdNext(const Command &c, Args &a);
int CmdPrev(const Command &c, Args &a);
int CmdSeek(const Command &c, Args &a);
int CmdVolume(const Command &c, Args &a);
int CmdMute(const Command &c, Args &a);
int CmdRepeat(const Command &c, Args &a);
int CmdShuffle(const Command &c, Args &a);
int CmdStatus(const Command &c, Args &a);
int CmdCurrent(const Command &c, Args &a);
int CmdEq(const Command &c, Args &a);

// ---- queue (cmd_queue.cpp) ----
int FetchQueue(Json::Value *items, Json::Value *head);
void PrintSongTable(const std::vector<Json::Value> &songs, int markIndex, bool numbered);
// Adds records to the queue; says how many. 0 or 1.
int AddRecords(const std::vector<std::unique_ptr<TARN_MEDIA_INFO>> &songs);
int AddArgs(const Args &args);
int CmdAdd(const Command &c, Args &a);
int CmdInsert(const Command &c, Args &a);
int CmdDel(const Command &c, Args &a);
int CmdClear(const Command &c, Args &a);
int CmdQueue(const Command &c, Args &a);

// ---- library (cmd_library.cpp) ----
int CmdSearch(const Command &c, Args &a);
int CmdLs(const Command &c, Args &a);
int CmdPlaylists(const Command &c, Args &a);
int CmdLoad(const Command &c, Args &a);
int CmdSave(const Command &c, Args &a);

// ---- sources, slots, players and network (cmd_sources.cpp) ----
int CmdSource(const Command &c, Args &a);
int CmdSlot(const Command &c, Args &a);
int CmdServers(const Command &c, Args &a);
int CmdRenderers(const Command &c, Args &a);
int CmdDiscover(const Command &c, Args &a);
int CmdSelect(const Command &c, Args &a);
int CmdChanged(const Command &c, Args &a);

// ---- waiting and watching (cmd_watch.cpp) ----
int CmdWait(const Command &c, Args &a);
int CmdWatch(const Command &c, Args &a);

}  // namespace tarnctl

#endif
