// The play queue of one player: songs, order, current entry, repeat mode
// and shuffle. Its JSON views and control-request actions are in
// player/playlist_actions.h.
#ifndef TARN_PLAYLIST_H
#define TARN_PLAYLIST_H

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

#include "platform/tarn_media_info.h"

// Longest queue unless "audio_queue_max" of the configuration file says
// otherwise (read once per process); a song beyond it is refused.
#define PLAYLIST_DEFAULT_MAX 20000

// The longest queue of this process.
size_t PlaylistMaxSongs();

// One queued song: what the daemon reads of a record, each text sized to
// its content. A full record is rebuilt only where one is handed on.
struct QueueEntry {
    uint32_t id = 0;
    int32_t track = 0, disc = 0, year = 0;
    float duration = 0;
    uint32_t bitrate = 0;
    int32_t sample = 0, channels = 0;
    uint64_t size = 0;
    std::string path, title, album, artist, genre, albumArtUrl;

    // The texts of info are read up to their field sizes (clients need not
    // terminate them).
    void FromMediaInfo(const TARN_MEDIA_INFO &info);
    void ToMediaInfo(TARN_MEDIA_INFO *out) const;
};

class Playlist {
public:
    Playlist();
    ~Playlist();
    Playlist(const Playlist &) = delete;
    Playlist &operator=(const Playlist &) = delete;

    int AddSong(const TARN_MEDIA_INFO *info);
    int RemoveSong(unsigned index);
    int Clear();
    int InsertSong(unsigned index, const TARN_MEDIA_INFO *info);
    int SetCurrent(unsigned index);
    // mode is one of REPEAT_MODE_* (wire/tarn_wire.h); any non-zero value is
    // stored.
    int SetMode(int mode);
    int GetMode() const;
    int ToggleShuffle();
    int ToggleRepeatMode();
    bool IsShuffle() const;
    // Rebuilds the current entry's record into *out.
    int GetCurrentSong(TARN_MEDIA_INFO *out);
    int GetCurrentUri(std::string &uri);
    int Next(std::string &uri, bool automatic);
    int Previous(std::string &uri, bool automatic);
    // The entry that Next(uri, true) would move to, without moving: 0 and
    // *entry, or -1 at the end of the queue ("Normal") or when it is empty.
    int PeekNext(unsigned *entry) const;

    unsigned Count() const { return static_cast<unsigned>(entries.size()); }
    unsigned Current() const { return current; }
    unsigned OrderIndex() const { return orderIndex; }
    const std::vector<int32_t> &Order() const { return order; }
    const QueueEntry *Entry(unsigned index) const
    {
        return index < entries.size() ? entries[index] : nullptr;
    }

private:
    void ResetOrder();
    void ShuffleOrder();

    std::vector<QueueEntry *> entries;
    std::vector<int32_t> order;
    uint32_t current;
    uint32_t orderIndex;
    int32_t mode;
    bool shuffle;
};

#endif
