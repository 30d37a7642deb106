// The queue's JSON views and its control-request actions.
#include "player/playlist_actions.h"

#include <algorithm>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

#include "platform/tarn_log.h"

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

int PlaylistHandleAction(Playlist &playlist, const ControlRequest *request, Json::Value &reply)
{
    if (!request) {
        TLOG("Bad parameter");
        return -1;
    }
    // The request text, bounded by the parameter area.
    std::string text(request->parameter, strnlen(request->parameter, sizeof(request->parameter)));
    switch (request->action) {
    case ACT_QUEUE_ADD: {
        TARN_MEDIA_INFO info;
        memcpy(&info, request->parameter, sizeof(info));
        if (playlist.AddSong(&info) != 0 && playlist.Count() >= PlaylistMaxSongs())
            reply["error"] = "the queue is full: " + std::to_string(PlaylistMaxSongs()) + " songs (audio_queue_max)";
        break;
    }
    case ACT_QUEUE_REMOVE:
        playlist.RemoveSong(static_cast<unsigned>(ParseDecimal(text)));
        break;
    case ACT_QUEUE_CLEAR:
        playlist.Clear();
        break;
    case ACT_QUEUE_INSERT: {
        TARN_MEDIA_INFO info;
        memcpy(&info, request->parameter, sizeof(info));
        int32_t index = 0;
        memcpy(&index, reinterpret_cast<const char *>(request) + CTRL_INSERT_POS_OFFSET, sizeof(index));
        if (playlist.InsertSong(static_cast<unsigned>(index), &info) != 0 && playlist.Count() >= PlaylistMaxSongs())
            reply["error"] = "the queue is full: " + std::to_string(PlaylistMaxSongs()) + " songs (audio_queue_max)";
        break;
    }
    case ACT_QUEUE_SET_CURRENT:
        playlist.SetCurrent(static_cast<unsigned>(ParseDecimal(text)));
        break;
    case ACT_SET_REPEAT_MODE:
        playlist.SetMode(ParseDecimal(text));
        break;
    case ACT_TOGGLE_SHUFFLE:
        playlist.ToggleShuffle();
        break;
    case ACT_QUEUE_LIST: {
        int start = 0;
        int limit = 0;
        sscanf(text.c_str(), "%d %d", &start, &limit);
        PlaylistListJson(playlist, start, limit, reply);
        break;
    }
    case ACT_CYCLE_REPEAT_MODE:
        playlist.ToggleRepeatMode();
        break;
    default:
        TarnLog("%s:%d Action [%d] not handled", kLogUnit, 567, request->action);
        return -1;
    }
    return 0;
}
