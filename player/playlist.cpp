#include "player/playlist.h"

#include <algorithm>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <new>

#include <malloc.h>

#include "platform/tarn_media_info.h"
#include "wire/tarn_wire.h"
#include "platform/tarn_env.h"
#include "platform/tarn_log.h"
#include "platform/tlibc_conf.h"
#include "player/tarn_rand.h"

static const char kLogUnit[] = "playlist";

namespace {

// Repeat mode names, indexed by the mode number (REPEAT_MODE_*).
const char *const kModeNames[] = {"NONE", "Normal", "Repeat One", "Repeat All"};
// Shown for a stored mode outside the table (SetMode stores any non-zero value).
const char kModeUnknown[] = "Unknown";

const char kDefaultAlbumArt[] = "modules/Aurelon/images/thumb/thumb_file.png";

// Text fields of a record come from clients and need not be NUL-terminated:
// read them only up to their field size.
template <size_t N>
std::string Field(const char (&text)[N])
{
    return std::string(text, strnlen(text, N));
}

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

// Copies text into a fixed field, NUL-terminated.
template <size_t N>
void Put(char (&field)[N], const std::string &text)
{
    snprintf(field, N, "%s", text.c_str());
}

}  // namespace

void QueueEntry::FromMediaInfo(const TARN_MEDIA_INFO &info)
{
    id = info.id;
    track = info.track;
    disc = info.disc;
    year = info.year;
    duration = info.duration;
    bitrate = info.bitrate;
    sample = info.sample;
    channels = info.channels;
    size = info.size;
    path = Field(info.path);
    title = Field(info.title);
    album = Field(info.album);
    artist = Field(info.artist);
    genre = Field(info.genre);
    albumArtUrl = Field(info.albumArtUrl);
}

void QueueEntry::ToMediaInfo(TARN_MEDIA_INFO *out) const
{
    memset(out, 0, sizeof(*out));
    out->id = id;
    out->track = track;
    out->disc = disc;
    out->year = year;
    out->duration = duration;
    out->bitrate = bitrate;
    out->sample = sample;
    out->channels = channels;
    out->size = size;
    Put(out->path, path);
    Put(out->title, title);
    Put(out->album, album);
    Put(out->artist, artist);
    Put(out->genre, genre);
    Put(out->albumArtUrl, albumArtUrl);
}

Playlist::Playlist() : current(0), orderIndex(0), mode(REPEAT_MODE_OFF), shuffle(false)
{
}

Playlist::~Playlist()
{
    for (QueueEntry *entry : entries)
        delete entry;
}

void Playlist::ResetOrder()
{
    order.clear();
    for (size_t i = 0; i < entries.size(); ++i)
        order.push_back(static_cast<int32_t>(i));
    orderIndex = current;
}

void Playlist::ShuffleOrder()
{
    if (!shuffle)
        return;
    // Forward Fisher-Yates walk over the daemon's fixed random sequence, so
    // that every start replays the same shuffles.
    for (size_t i = 1; i < order.size(); ++i) {
        size_t j = static_cast<size_t>(TarnRand()) % (i + 1);
        std::swap(order[i], order[j]);
    }
    orderIndex = 0;
}

namespace {

// Longest queue: "audio_queue_max" of the configuration file, read once.
size_t QueueMax()
{
    static size_t max = [] {
        char value[32];
        std::string conf = TarnPath(TARN_INFO_CONF);
        long n = 0;
        if (TLIBCFileGetKeyValue(conf.c_str(), "audio_queue_max", value, sizeof(value), 0) > 0)
            n = strtol(value, nullptr, 10);
        return n > 0 ? static_cast<size_t>(n) : static_cast<size_t>(PLAYLIST_DEFAULT_MAX);
    }();
    return max;
}

// A compact copy of a song record, with room made in both vectors so that
// adding it cannot fail half-way. Null (logged) when the queue is full or
// memory runs out.
QueueEntry *NewEntry(const TARN_MEDIA_INFO *info, std::vector<QueueEntry *> &entries,
                     std::vector<int32_t> &order)
{
    if (entries.size() >= QueueMax()) {
        TLOG("The queue is full: %zu songs (audio_queue_max)", entries.size());
        return nullptr;
    }
    QueueEntry *copy = nullptr;
    try {
        copy = new QueueEntry();
        copy->FromMediaInfo(*info);
        // Grown by doubling: a reserve of one more would copy the whole
        // vector on every add.
        if (entries.capacity() == entries.size())
            entries.reserve(entries.size() * 2 + 16);
        if (order.capacity() <= entries.size())
            order.reserve(entries.capacity());
        return copy;
    } catch (const std::bad_alloc &) {
        delete copy;
    }
    TLOG("Failed to new TARN_MEDIA_INFO");
    return nullptr;
}

}  // namespace

int Playlist::AddSong(const TARN_MEDIA_INFO *info)
{
    if (!info) {
        TLOG("Bad parameter");
        return -1;
    }
    QueueEntry *copy = NewEntry(info, entries, order);
    if (!copy)
        return -1;
    entries.push_back(copy);
    order.push_back(static_cast<int32_t>(entries.size() - 1));
    ShuffleOrder();
    return 0;
}

int Playlist::RemoveSong(unsigned index)
{
    if (index >= entries.size()) {
        TLOG("Bad parameters");
        return -1;
    }
    if (!entries[index]) {
        TLOG("URL_INFO at %d in list is NULL", static_cast<int>(index));
        return -1;
    }
    delete entries[index];
    entries.erase(entries.begin() + index);
    if (index < current)
        --current;
    ResetOrder();
    ShuffleOrder();
    return 0;
}

int Playlist::Clear()
{
    for (QueueEntry *entry : entries)
        delete entry;
    std::vector<QueueEntry *>().swap(entries);
    std::vector<int32_t>().swap(order);
    current = 0;
    orderIndex = 0;
    // Give the memory of a long queue back to the system.
    malloc_trim(0);
    return 0;
}

int Playlist::InsertSong(unsigned index, const TARN_MEDIA_INFO *info)
{
    // Inserting at the end (or into an empty queue) is refused: that is AddSong.
    if (!info || index >= entries.size()) {
        TLOG("Bad parameters");
        return -1;
    }
    QueueEntry *copy = NewEntry(info, entries, order);
    if (!copy)
        return -1;
    entries.insert(entries.begin() + index, copy);
    if (index < current)
        ++current;
    ResetOrder();
    ShuffleOrder();
    return 0;
}

int Playlist::SetCurrent(unsigned index)
{
    if (index >= entries.size()) {
        TLOG("Bad parameters");
        return -1;
    }
    current = index;
    if (!shuffle) {
        orderIndex = index;
        return 0;
    }
    for (size_t k = 0; k < order.size(); ++k) {
        if (order[k] == static_cast<int32_t>(index)) {
            orderIndex = static_cast<uint32_t>(k);
            break;
        }
    }
    return 0;
}

int Playlist::SetMode(int newMode)
{
    if (newMode == REPEAT_MODE_NONE) {
        TLOG("Bad parameter");
        return -1;
    }
    mode = newMode;
    // Shuffle and "Repeat One" never stand together.
    if (mode == REPEAT_MODE_ONE && shuffle)
        ToggleShuffle();
    return 0;
}

int Playlist::GetMode() const
{
    return mode;
}

int Playlist::ToggleShuffle()
{
    if (shuffle) {
        shuffle = false;
        ResetOrder();
    } else {
        shuffle = true;
        ShuffleOrder();
        if (mode == REPEAT_MODE_ONE)
            mode = REPEAT_MODE_OFF;
    }
    return 0;
}

int Playlist::ToggleRepeatMode()
{
    switch (mode) {
    case REPEAT_MODE_OFF:
        return SetMode(REPEAT_MODE_ONE);
    case REPEAT_MODE_ONE:
        return SetMode(REPEAT_MODE_ALL);
    case REPEAT_MODE_ALL:
        return SetMode(REPEAT_MODE_OFF);
    default:
        TLOG("Failed to toggle repeat mode. Invalid playlist mode [%d]", mode);
        return 0;
    }
}

bool Playlist::IsShuffle() const
{
    return shuffle;
}

int Playlist::GetCurrentSong(TARN_MEDIA_INFO *out)
{
    if (entries.empty() || order.empty()) {
        TLOG("Playlist is empty");
        return -1;
    }
    // Repair indexes left behind by a removal.
    if (orderIndex >= order.size())
        orderIndex = 0;
    current = static_cast<uint32_t>(order[orderIndex]);
    if (current >= entries.size())
        current = 0;
    const QueueEntry *entry = entries[current];
    if (!entry) {
        TLOG("URL_INFO at %d in list is NULL", static_cast<int>(current));
        return -1;
    }
    if (out)
        entry->ToMediaInfo(out);
    return 0;
}

int Playlist::GetCurrentUri(std::string &uri)
{
    if (GetCurrentSong(nullptr) != 0)
        return -1;
    uri = entries[current]->path;
    return 0;
}

int Playlist::GetCurrentInfoJson(Json::Value &info)
{
    if (current >= entries.size() || !entries[current]) {
        TLOG("Bad current index [%u]", current);
        return -1;
    }
    const QueueEntry *entry = entries[current];
    info["title"] = DisplayTitle(entry);
    info["current"] = static_cast<int>(current);
    info["artist"] = entry->artist;
    info["path"] = entry->path;
    return 0;
}

int Playlist::Next(std::string &uri, bool automatic)
{
    size_t n = order.size();
    if (n == 0 || mode < REPEAT_MODE_OFF) {
        TLOG("Cannot step forward: %zu songs, mode [%d]", n, mode);
        return -1;
    }
    if (mode == REPEAT_MODE_OFF || (mode == REPEAT_MODE_ONE && !automatic)) {
        if (orderIndex + 1 >= n) {
            TLOG("End of the playlist");
            return -1;
        }
        ++orderIndex;
    } else if (mode == REPEAT_MODE_ONE) {
        // The song ended by itself: play it again.
        if (orderIndex >= n)
            orderIndex = 0;
    } else if (mode == REPEAT_MODE_ALL) {
        ++orderIndex;
        if (orderIndex >= n)
            orderIndex = 0;
    } else {
        TLOG("Invalid playlist mode [%d]", mode);
        return -1;
    }
    return GetCurrentUri(uri);
}

int Playlist::PeekNext(unsigned *entry) const
{
    size_t n = order.size();
    if (n == 0 || mode < REPEAT_MODE_OFF || mode > REPEAT_MODE_ALL || entry == nullptr)
        return -1;
    size_t k = orderIndex >= n ? 0 : orderIndex;
    if (mode == REPEAT_MODE_OFF) {
        if (k + 1 >= n)
            return -1;
        ++k;
    } else if (mode == REPEAT_MODE_ALL) {
        k = (k + 1) % n;
    }
    int32_t e = order[k];
    if (e < 0 || static_cast<size_t>(e) >= entries.size() || !entries[static_cast<size_t>(e)])
        return -1;
    *entry = static_cast<unsigned>(e);
    return 0;
}

int Playlist::Previous(std::string &uri, bool automatic)
{
    size_t n = order.size();
    if (n == 0 || mode < REPEAT_MODE_OFF) {
        TLOG("Cannot step back: %zu songs, mode [%d]", n, mode);
        return -1;
    }
    if (mode == REPEAT_MODE_ALL) {
        if (orderIndex == 0)
            orderIndex = static_cast<uint32_t>(n - 1);
        else
            --orderIndex;
    } else if (mode == REPEAT_MODE_OFF || (mode == REPEAT_MODE_ONE && !automatic)) {
        if (orderIndex == 0) {
            TLOG("Beginning of the playlist");
            return -1;
        }
        --orderIndex;
    } else if (mode == REPEAT_MODE_ONE) {
        if (orderIndex >= n)
            orderIndex = 0;
    } else {
        TLOG("Invalid playlist mode [%d]", mode);
        return -1;
    }
    return GetCurrentUri(uri);
}

int Playlist::ListJson(int start, int limit, Json::Value &reply)
{
    if (start < 0)
        start = 0;
    if (limit < 0)
        limit = 20;
    Json::Value uris(Json::arrayValue);
    int64_t first = start;
    int64_t end = static_cast<int64_t>(entries.size());
    // No reply holds more entries than this (each takes over 250 of its
    // 8192 bytes); a longer page would only be built to be cut.
    const int64_t kMostPerPage = 64;
    if (limit <= 0 || limit > kMostPerPage)
        limit = kMostPerPage;
    end = std::min(end, first + limit);
    for (int64_t i = first; i < end; ++i) {
        const QueueEntry *e = entries[static_cast<size_t>(i)];
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
    reply["total"] = static_cast<int>(entries.size());
    reply["current"] = static_cast<Json::UInt>(current);
    reply["mode"] = ModeName(mode);
    reply["shuffle"] = shuffle;
    reply["order_index"] = static_cast<Json::UInt>(orderIndex);
    return 0;
}

int Playlist::HandleAction(const ControlRequest *request, Json::Value &reply)
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
        if (AddSong(&info) != 0 && entries.size() >= QueueMax())
            reply["error"] = "the queue is full: " + std::to_string(QueueMax()) + " songs (audio_queue_max)";
        break;
    }
    case ACT_QUEUE_REMOVE:
        RemoveSong(static_cast<unsigned>(ParseDecimal(text)));
        break;
    case ACT_QUEUE_CLEAR:
        Clear();
        break;
    case ACT_QUEUE_INSERT: {
        TARN_MEDIA_INFO info;
        memcpy(&info, request->parameter, sizeof(info));
        int32_t index = 0;
        memcpy(&index, reinterpret_cast<const char *>(request) + CTRL_INSERT_POS_OFFSET, sizeof(index));
        if (InsertSong(static_cast<unsigned>(index), &info) != 0 && entries.size() >= QueueMax())
            reply["error"] = "the queue is full: " + std::to_string(QueueMax()) + " songs (audio_queue_max)";
        break;
    }
    case ACT_QUEUE_SET_CURRENT:
        SetCurrent(static_cast<unsigned>(ParseDecimal(text)));
        break;
    case ACT_SET_REPEAT_MODE:
        SetMode(ParseDecimal(text));
        break;
    case ACT_TOGGLE_SHUFFLE:
        ToggleShuffle();
        break;
    case ACT_QUEUE_LIST: {
        int start = 0;
        int limit = 0;
        sscanf(text.c_str(), "%d %d", &start, &limit);
        ListJson(start, limit, reply);
        break;
    }
    case ACT_CYCLE_REPEAT_MODE:
        ToggleRepeatMode();
        break;
    default:
        TarnLog("%s:%d Action [%d] not handled", kLogUnit, 567, request->action);
        return -1;
    }
    return 0;
}
