#include "player/playlist.h"

#include <algorithm>
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

// Text fields of a record come from clients and need not be NUL-terminated:
// read them only up to their field size.
template <size_t N>
std::string Field(const char (&text)[N])
{
    return std::string(text, strnlen(text, N));
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

size_t PlaylistMaxSongs()
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

namespace {

// A compact copy of a song record, with room made in both vectors so that
// adding it cannot fail half-way. Null (logged) when the queue is full or
// memory runs out.
QueueEntry *NewEntry(const TARN_MEDIA_INFO *info, std::vector<QueueEntry *> &entries,
                     std::vector<int32_t> &order)
{
    if (entries.size() >= PlaylistMaxSongs()) {
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
