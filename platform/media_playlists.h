// The media library's playlist functions used by the daemon: the random
// selection, saved (M3U) playlists, smart playlists, the iPod track list, the
// custom slots and the song lookup by id.
//
// All of them open the library database (MediaLibDefaultPath(), see
// medialib.h) for the duration of the call, so a rescan by the tarnlib tool
// is seen at the next call. Song lists come back in C++ containers; every
// TARN_MEDIA_INFO record is fully zeroed before its fields are filled, and
// the album-art URL is always left empty (the daemon fills it).
#ifndef TARN_MEDIA_PLAYLISTS_H
#define TARN_MEDIA_PLAYLISTS_H

#include <cstdint>
#include <list>
#include <string>
#include <vector>

#include "platform/tarn_media_info.h"
#include "platform/tarn_env.h"

namespace AudioFile {

// Writes a playlist file of `count` distinct songs picked at random from the
// library to `path` (an M3U8 text with absolute paths; written to a temporary
// file beside it and renamed over it, so an old file is replaced whole).
// When the library holds fewer songs, all of them are written, in random
// order. The caller names the file, e.g.
// TarnPath("/tmp/==DynaRandom100==.@remote_control").
// Returns non-zero when the file was written with at least one song, 0 on
// failure (no library, empty library, unwritable path, count < 1).
int PlaylistRandomCreate(const char *path, int count);

// A loaded playlist file: its songs in play order.
class PlaylistFile {
public:
    std::string title;                 // #PLAYLIST text, or the file name
    std::vector<TARN_MEDIA_INFO> songs;  // in play order
    size_t Count() const { return songs.size(); }
};

// Reads the playlist file at path (M3U/M3U8). Entries are resolved against
// the file's folder; each song is taken from the library (with its id) or,
// when the library does not know it, read from the file's tags (id 0).
// Entries whose file is missing or unplayable are skipped.
// start/limit select a page of the songs (limit 0: all from start).
// Returns a heap object the caller deletes, or null when the file cannot be
// read. A readable playlist without any playable song gives an object with
// no songs.
PlaylistFile *PlaylistFileLoad(const char *path, int start, int limit);

}  // namespace AudioFile

// One saved playlist of the library.
struct TARN_PLAYLIST_INFO {
    std::string path;   // media-library path: the absolute path of the M3U file
    std::string title;  // #PLAYLIST text, or the file name without extension
};

// Lists the saved playlists of the library in the library's order (by title,
// then path). start: index of the first one; limit: at most this many (0: all);
// flags: reserved (pass 0). Daemon calls: (list, 0, 1, 0) for the first
// playlist, (list, 0, 0, 0) for all.
// Returns 0 on success (list may be empty: no saved playlists), -1 when the
// library cannot be read.
int TARNPlaylistListAll(std::vector<TARN_PLAYLIST_INFO> &list, int start, int limit, int flags);

// Songs of the saved playlist at path (a path from TARNPlaylistListAll or any
// M3U file), in file order; missing files are skipped. start/limit page the
// songs (limit 0: all); field is a field pattern ("*": all fields) and
// resolve is reserved (pass 1); both are accepted for the daemon's call
// (path, &count, 0, 0, "*", 1, songs).
// Returns 0 when the playlist has at least one playable song (*count = number
// of songs in songs), -1 when it cannot be read or has no playable song
// (*count = 0, songs empty) - the daemon treats both as "no playlist".
int ParsePlayListByFieldGivenPath(const char *path, int *count, int start, int limit,
                                  const char *field, int resolve,
                                  std::vector<TARN_MEDIA_INFO> &songs);

// Title of the saved playlist at path into title (snprintf limit size).
// Returns 0 on success, -1 when path is not a readable playlist.
int TARNPlaylistTitleGetByPath(const char *path, char *title, int size);

namespace MediaServer {

// Names of the smart playlists in the library's order (creation order).
// start/limit page the names (limit 0: all); total := number of smart
// playlists in the library; filter is reserved (pass null).
// An unreadable library gives an empty vector and total = 0.
std::vector<std::string> SmartPLSEnum(int start, int limit, int &total, const char *filter);

// Songs matching the rules of the smart playlist at `index` in SmartPLSEnum's
// full order (0-based), appended to songs in the library's order (artist,
// album, disc, track, path). start/limit page the songs (limit 0: all);
// total := number of matching songs.
// Returns 0 on success, -1 for a bad index or an unreadable library.
int SmartPLSListSongs(int index, int start, int limit, int &total,
                      std::list<TARN_MEDIA_INFO> &songs);

}  // namespace MediaServer

// The iPod track list: an M3U file (daemon: TarnPath of
// "/usr/tarn/etc/audio/ipod/tracks.m3u") naming the tracks of a connected
// portable player. Entries are resolved like saved playlists, #EXTINF titles
// are used when the library does not know the song; missing files are skipped.
// start/limit page the tracks (limit 0: all).
// Returns the number of tracks placed in songs (0 when none), -1 when the
// list cannot be read (missing file included).
int TARNIPodListSongsAll(const char *path, std::vector<TARN_MEDIA_INFO> &songs, int start,
                         int limit);

// Custom slots: numbered presets of three texts (type "playlist", "smart" or
// "radio", then two texts whose meaning depends on the type). They live in
// the audio settings file TarnPath("/usr/tarn/etc/audio/custom_slots.json"),
// replaced whole on every store (temporary file, fsync, rename).
// Get returns 0 and the three texts, -1 when the slot is empty or the file
// cannot be read. Set returns 0 on success, -1 on failure (file unchanged).
int TARNAudioCustomGet(int slot, std::string &type, std::string &second, std::string &third);
int TARNAudioCustomSet(int slot, const std::string &type, const std::string &second,
                       const std::string &third);

// The song with this id, for the song server. Returns 1 and fills *info
// (zeroed first) when found, 0 when no song has the id, -1 on error (no or
// unreadable library, null info).
int MediaLibFindById(uint32_t id, TARN_MEDIA_INFO *info);

// Path of the song with this id into path (snprintf limit size).
// Returns 1 found, 0 not found, -1 error.
int MediaLibPathById(uint32_t id, char *path, size_t size);

#endif
