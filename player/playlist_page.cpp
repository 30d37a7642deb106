#include "player/playlist_page.h"

#include <algorithm>
#include <cmath>
#include <cstdint>
#include <cstdio>
#include <string_view>
#include <vector>

#include "platform/json_text.h"
#include "wire/tarn_wire.h"

namespace {

// Repeat mode names, indexed by the mode number (REPEAT_MODE_*).
const char *const kModeNames[] = {"NONE", "Normal", "Repeat One", "Repeat All"};
// Shown for a stored mode outside the table (SetMode stores any non-zero value).
const char kModeUnknown[] = "Unknown";

const char kDefaultAlbumArt[] = "modules/Aurelon/images/thumb/thumb_file.png";

// No page holds more entries than this (each takes over 250 of a reply's
// 8192 bytes); a longer page would only be built to be cut.
const int64_t kMostPerPage = 64;

const char *ModeName(int32_t mode)
{
    if (mode < REPEAT_MODE_NONE || mode > REPEAT_MODE_ALL)
        return kModeUnknown;
    return kModeNames[mode];
}

std::string_view DisplayTitle(const QueueEntry *entry)
{
    if (!entry->title.empty())
        return entry->title;
    const std::string &path = entry->path;
    size_t slash = path.rfind('/');
    if (slash != std::string::npos && slash + 1 < path.size())
        return std::string_view(path).substr(slash + 1);
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

// The entries [first, end) a request for (start, limit) names.
struct PageRange {
    int64_t first, end;
};

PageRange Range(const Playlist &playlist, int start, int limit)
{
    if (start < 0)
        start = 0;
    if (limit < 0)
        limit = 20;
    if (limit == 0 || limit > kMostPerPage)
        limit = kMostPerPage;
    int64_t first = start;
    return {first, std::min(static_cast<int64_t>(playlist.Count()), first + limit)};
}

// Members into a JSON value.
struct ValueSink {
    Json::Value &object;
    void Text(const char *key, std::string_view v)
    {
        object[Json::StaticString(key)] = Json::Value(v.data(), v.data() + v.size());
    }
    void Int(const char *key, int v) { object[Json::StaticString(key)] = v; }
    void Uint(const char *key, unsigned v) { object[Json::StaticString(key)] = static_cast<Json::UInt>(v); }
    void Bool(const char *key, bool v) { object[Json::StaticString(key)] = v; }
};

// Members straight into the text.
struct TextSink {
    JsonTextWriter &writer;
    void Text(const char *key, std::string_view v)
    {
        writer.Key(key);
        writer.String(v.data(), static_cast<rapidjson::SizeType>(v.size()));
    }
    void Int(const char *key, int v)
    {
        writer.Key(key);
        writer.Int(v);
    }
    void Uint(const char *key, unsigned v)
    {
        writer.Key(key);
        writer.Uint(v);
    }
    void Bool(const char *key, bool v)
    {
        writer.Key(key);
        writer.Bool(v);
    }
};

// An entry's members, in the order of their names (the order a JSON value
// keeps them in, so that both forms give the same text).
template <typename Sink>
void EntryMembers(const QueueEntry *e, int64_t sequence, Sink &out)
{
    char text[32];
    out.Text("album", e->album);
    out.Text("albumArtURL", !e->albumArtUrl.empty() ? std::string_view(e->albumArtUrl) : kDefaultAlbumArt);
    out.Text("artist", e->artist);
    out.Uint("bitrate", e->bitrate);
    out.Int("channels", static_cast<int>(e->channels));
    out.Int("disc", static_cast<int>(e->disc));
    out.Int("duration", DurationSeconds(e->duration));
    out.Text("genre", e->genre);
    int n = snprintf(text, sizeof(text), "playing@%lu", static_cast<unsigned long>(e->id));
    out.Text("item_id", std::string_view(text, static_cast<size_t>(n)));
    out.Text("item_pid", "playing_root");
    out.Text("res", e->path);
    out.Int("sample", static_cast<int>(e->sample));
    out.Int("sequence", static_cast<int>(sequence));
    n = snprintf(text, sizeof(text), "%llu", static_cast<unsigned long long>(e->size));
    out.Text("size", std::string_view(text, static_cast<size_t>(n)));
    out.Text("title", DisplayTitle(e));
    out.Int("track", static_cast<int>(e->track));
    out.Int("year", static_cast<int>(e->year));
}

// The page's members before "uris" (the last by name).
template <typename Sink>
void HeadMembers(const Playlist &playlist, Sink &out)
{
    out.Uint("current", playlist.Current());
    out.Text("mode", ModeName(playlist.GetMode()));
    out.Uint("order_index", playlist.OrderIndex());
    out.Bool("shuffle", playlist.IsShuffle());
    out.Int("total", static_cast<int>(playlist.Count()));
}

// Writes the page with the entries [first, end); *ends (when given) gets the
// text's length after each entry written.
void WritePage(const Playlist &playlist, int64_t first, int64_t end, rapidjson::StringBuffer &buffer,
               std::vector<size_t> *ends)
{
    JsonTextWriter writer(buffer);
    JsonTextSetup(writer);
    TextSink out{writer};
    writer.StartObject();
    HeadMembers(playlist, out);
    writer.Key("uris");
    writer.StartArray();
    for (int64_t i = first; i < end; ++i) {
        const QueueEntry *e = playlist.Entry(static_cast<unsigned>(i));
        if (!e)
            continue;
        writer.StartObject();
        EntryMembers(e, i, out);
        writer.EndObject();
        if (ends)
            ends->push_back(buffer.GetSize());
    }
    writer.EndArray();
    writer.EndObject();
}

}  // namespace

std::string PlaylistDisplayTitle(const QueueEntry *entry)
{
    return std::string(DisplayTitle(entry));
}

int PlaylistListJson(const Playlist &playlist, int start, int limit, Json::Value &reply)
{
    PageRange r = Range(playlist, start, limit);
    Json::Value uris(Json::arrayValue);
    for (int64_t i = r.first; i < r.end; ++i) {
        const QueueEntry *e = playlist.Entry(static_cast<unsigned>(i));
        if (!e)
            continue;
        Json::Value item(Json::objectValue);
        ValueSink out{item};
        EntryMembers(e, i, out);
        uris.append(std::move(item));
    }
    ValueSink out{reply};
    HeadMembers(playlist, out);
    reply["uris"] = std::move(uris);
    return 0;
}

int PlaylistPageText(const Playlist &playlist, int start, int limit, size_t most, std::string *text)
{
    if (!text)
        return -1;
    PageRange r = Range(playlist, start, limit);
    // Room for a whole reply from the start.
    rapidjson::StringBuffer buffer(nullptr, 2 * CTRL_REPLY_SIZE);
    std::vector<size_t> ends;
    ends.reserve(static_cast<size_t>(kMostPerPage));
    WritePage(playlist, r.first, r.end, buffer, &ends);
    // With its line feed; every entry's text is followed by the same end of
    // the array and the object, so the length with fewer entries is known.
    if (buffer.GetSize() + 1 > most && !ends.empty()) {
        size_t tail = buffer.GetSize() - ends.back();
        size_t keep = 0;
        while (keep < ends.size() && ends[keep] + tail + 1 <= most)
            keep++;
        // Entries are written in order, so the first `keep` written ones end
        // at the index of the keep-th written entry.
        int64_t end = r.first;
        for (size_t written = 0; written < keep && end < r.end; ++end)
            if (playlist.Entry(static_cast<unsigned>(end)))
                written++;
        buffer.Clear();
        WritePage(playlist, r.first, end, buffer, nullptr);
    }
    text->assign(buffer.GetString(), buffer.GetSize());
    text->push_back('\n');
    return 0;
}
