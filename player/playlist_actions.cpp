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

// Repeat mode names, indexed by the mode number (REPEAT_MODE_*).
const char *const kModeNames[] = {"NONE", "Normal", "Repeat One", "Repeat All"};
// Shown for a stored mode outside the table (SetMode stores any non-zero value).
const char kModeUnknown[] = "Unknown";

const char kDefaultAlbumArt[] = "modules/Aurelon/images/thumb/thumb_file.png";

const char *ModeName(int32_t mode)
{
    if (mode < REPEAT_MODE_NONE || mode > REPEAT_MODE_ALL)
        return kModeUnknown;
    return kModeNames[mode];
}

// The title shown for an entry: its title, else the file name of its path,
// else the whole path.
std::string DisplayTitle(const QueueEntry *entry)
{
    if (!entry->title.empty())
        return entry->title;
    const std::string &path = entry->path;
    size_t slash = path.rfind('/');
    if (slash != std::string::npos && slash + 1 < path.size())
        return path.substr(slash + 1);
    return path;
}

// The duration in whole seconds, truncated toward zero; 0 for values that do
// not fit an int.
int DurationSeconds(float duration)
{
    if (!std::isfinite(duration) || duration >= 2147483648.0f || duration <= -2147483649.0f)
        return 0;
    return static_cast<int>(duration);
}

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
    info["title"] = DisplayTitle(entry);
    info["current"] = static_cast<int>(current);
    info["artist"] = entry->artist;
    info["path"] = entry->path;
    return 0;
}

int PlaylistListJson(const Playlist &playlist, int start, int limit, Json::Value &reply)
{
    if (start < 0)
        start = 0;
    if (limit < 0)
        limit = 20;
    Json::Value uris(Json::arrayValue);
    int64_t first = start;
    int64_t end = static_cast<int64_t>(playlist.Count());
    // No reply holds more entries than this (each takes over 250 of its
    // 8192 bytes); a longer page would only be built to be cut.
    const int64_t kMostPerPage = 64;
    if (limit <= 0 || limit > kMostPerPage)
        limit = kMostPerPage;
    end = std::min(end, first + limit);
    for (int64_t i = first; i < end; ++i) {
        const QueueEntry *e = playlist.Entry(static_cast<unsigned>(i));
        if (!e)
            continue;
        Json::Value item(Json::objectValue);
        char text[64];
        snprintf(text, sizeof(text), "playing@%lu", static_cast<unsigned long>(e->id));
        item[Json::StaticString("item_id")] = text;
        item[Json::StaticString("album")] = e->album;
        item[Json::StaticString("artist")] = e->artist;
        item[Json::StaticString("albumArtURL")] = !e->albumArtUrl.empty() ? e->albumArtUrl : std::string(kDefaultAlbumArt);
        item[Json::StaticString("genre")] = e->genre;
        item[Json::StaticString("item_pid")] = "playing_root";
        item[Json::StaticString("title")] = DisplayTitle(e);
        item[Json::StaticString("bitrate")] = static_cast<Json::UInt>(e->bitrate);
        item[Json::StaticString("duration")] = DurationSeconds(e->duration);
        item[Json::StaticString("channels")] = static_cast<int>(e->channels);
        item[Json::StaticString("res")] = e->path;
        item[Json::StaticString("sample")] = static_cast<int>(e->sample);
        item[Json::StaticString("track")] = static_cast<int>(e->track);
        item[Json::StaticString("disc")] = static_cast<int>(e->disc);
        item[Json::StaticString("year")] = static_cast<int>(e->year);
        snprintf(text, sizeof(text), "%llu", static_cast<unsigned long long>(e->size));
        item[Json::StaticString("size")] = text;
        item[Json::StaticString("sequence")] = static_cast<int>(i);
        uris.append(std::move(item));
    }
    reply["uris"] = std::move(uris);
    reply["total"] = static_cast<int>(playlist.Count());
    reply["current"] = static_cast<Json::UInt>(playlist.Current());
    reply["mode"] = ModeName(playlist.GetMode());
    reply["shuffle"] = playlist.IsShuffle();
    reply["order_index"] = static_cast<Json::UInt>(playlist.OrderIndex());
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
