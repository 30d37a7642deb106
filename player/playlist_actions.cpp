// The queue's JSON views and its control-request actions.
#include "player/playlist_actions.h"

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

#include "platform/tarn_log.h"
#include "wire/action_table.h"

static const char kLogUnit[] = "playlist";

namespace {

// A decimal parameter read as the appliance's 32-bit strtol reads it: values
// beyond the 32-bit range saturate instead of wrapping into a valid index.
int32_t ParseDecimal(const std::string &text)
{
    long v = strtol(text.c_str(), nullptr, 10);
    if (v > INT32_MAX)
        return INT32_MAX;
    if (v < INT32_MIN)
        return INT32_MIN;
    return static_cast<int32_t>(v);
}

}  // namespace

int PlaylistCurrentInfoJson(const Playlist &playlist, Json::Value &info)
{
    unsigned current = playlist.Current();
    const QueueEntry *entry = playlist.Entry(current);
    if (!entry) {
        TLOG("Bad current index [%u]", current);
        return -1;
    }
    info["title"] = PlaylistDisplayTitle(entry);
    info["current"] = static_cast<int>(current);
    info["artist"] = entry->artist;
    info["path"] = entry->path;
    return 0;
}

namespace {

// What a queue action gets: the request, its text bounded by the parameter
// area, and the reply.
typedef void (*QueueHandler)(Playlist &playlist, const ControlRequest *request,
                             const std::string &text, Json::Value &reply);

struct QueueAction {
    int action;
    QueueHandler handle;
};

// A song refused because the queue is full says so in the reply.
void NoteFull(const Playlist &playlist, int rc, Json::Value &reply)
{
    if (rc != 0 && playlist.Count() >= PlaylistMaxSongs())
        reply["error"] = "the queue is full: " + std::to_string(PlaylistMaxSongs()) + " songs (audio_queue_max)";
}

void QueueAdd(Playlist &playlist, const ControlRequest *request, const std::string &, Json::Value &reply)
{
    TARN_MEDIA_INFO info;
    memcpy(&info, request->parameter, sizeof(info));
    NoteFull(playlist, playlist.AddSong(&info), reply);
}

void QueueRemove(Playlist &playlist, const ControlRequest *, const std::string &text, Json::Value &)
{
    playlist.RemoveSong(static_cast<unsigned>(ParseDecimal(text)));
}

void QueueClear(Playlist &playlist, const ControlRequest *, const std::string &, Json::Value &)
{
    playlist.Clear();
}

void QueueInsert(Playlist &playlist, const ControlRequest *request, const std::string &, Json::Value &reply)
{
    TARN_MEDIA_INFO info;
    memcpy(&info, request->parameter, sizeof(info));
    int32_t index = 0;
    memcpy(&index, reinterpret_cast<const char *>(request) + CTRL_INSERT_POS_OFFSET, sizeof(index));
    NoteFull(playlist, playlist.InsertSong(static_cast<unsigned>(index), &info), reply);
}

void QueueSetCurrent(Playlist &playlist, const ControlRequest *, const std::string &text, Json::Value &)
{
    playlist.SetCurrent(static_cast<unsigned>(ParseDecimal(text)));
}

void QueueSetMode(Playlist &playlist, const ControlRequest *, const std::string &text, Json::Value &)
{
    playlist.SetMode(ParseDecimal(text));
}

void QueueShuffle(Playlist &playlist, const ControlRequest *, const std::string &, Json::Value &)
{
    playlist.ToggleShuffle();
}

// The start and limit of a page request ("%d %d", each 0 when missing).
void PageOf(const std::string &text, int *start, int *limit)
{
    *start = 0;
    *limit = 0;
    sscanf(text.c_str(), "%d %d", start, limit);
}

void QueueList(Playlist &playlist, const ControlRequest *, const std::string &text, Json::Value &reply)
{
    int start, limit;
    PageOf(text, &start, &limit);
    PlaylistListJson(playlist, start, limit, reply);
}

void QueueCycleMode(Playlist &playlist, const ControlRequest *, const std::string &, Json::Value &)
{
    playlist.ToggleRepeatMode();
}

// The queue's actions: the one list of them; both players hand these over.
const QueueAction kQueueActions[] = {
    {ACT_QUEUE_ADD, QueueAdd},
    {ACT_QUEUE_REMOVE, QueueRemove},
    {ACT_QUEUE_CLEAR, QueueClear},
    {ACT_QUEUE_INSERT, QueueInsert},
    {ACT_QUEUE_SET_CURRENT, QueueSetCurrent},
    {ACT_SET_REPEAT_MODE, QueueSetMode},
    {ACT_TOGGLE_SHUFFLE, QueueShuffle},
    {ACT_QUEUE_LIST, QueueList},
    {ACT_CYCLE_REPEAT_MODE, QueueCycleMode},
};

}  // namespace

bool PlaylistTakesAction(int action)
{
    return FindAction(kQueueActions, action) != nullptr;
}

int PlaylistHandleAction(Playlist &playlist, const ControlRequest *request, Json::Value &reply)
{
    if (!request) {
        TLOG("Bad parameter");
        return -1;
    }
    const QueueAction *q = FindAction(kQueueActions, request->action);
    if (!q) {
        TarnLog("%s:%d Action [%d] not handled", kLogUnit, 567, request->action);
        return -1;
    }
    // The request text, bounded by the parameter area.
    std::string text(request->parameter, strnlen(request->parameter, sizeof(request->parameter)));
    q->handle(playlist, request, text, reply);
    return 0;
}

void PlaylistPageReply(const Playlist &playlist, const ControlRequest *request, char out[CTRL_REPLY_SIZE])
{
    int start, limit;
    PageOf(std::string(request->parameter, strnlen(request->parameter, sizeof(request->parameter))), &start,
           &limit);
    std::string text;
    PlaylistPageText(playlist, start, limit, CTRL_REPLY_SIZE - 1, &text);
    memset(out, 0, CTRL_REPLY_SIZE);
    memcpy(out, text.data(), text.size());
}
