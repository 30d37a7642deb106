// The appliance's media library: an SQLite database of the songs of a music
// folder (tags and audio properties read with TagLib), the saved playlists
// (M3U/M3U8 files found in that folder) and the smart playlists (named rules
// over song fields).
//
// The database is opened in WAL mode with a busy timeout, so the daemon can
// read while the tarnlib tool rescans; a rescan runs in one transaction and
// readers see either the old or the new library.
#ifndef TARN_MEDIALIB_H
#define TARN_MEDIALIB_H

#include <sqlite3.h>

#include <cstdint>
#include <functional>
#include <string>
#include <vector>

#include "platform/tarn_media_info.h"
#include "platform/tarn_env.h"

// TarnPath("/usr/tarn/var/medialib.db") unless MediaLibSetDefaultPath was
// called (tools pass their --db option there).
std::string MediaLibDefaultPath();
void MediaLibSetDefaultPath(const std::string &path);

// True when the file name ends with an extension the library indexes
// (mp3, flac, ogg, oga, opus, wav, m4a, aac, wma, aif, aiff, ape, mpc, wv ...).
bool MediaLibIsAudioFile(const std::string &path);
// True for .m3u and .m3u8 files.
bool MediaLibIsPlaylistFile(const std::string &path);

// One song row of the library.
struct MediaSong {
    uint32_t id = 0;
    std::string path, title, album, artist, genre;
    int track = 0, disc = 0, year = 0;
    double duration = 0;  // seconds
    int bitrate = 0;      // kbit/s
    int sampleRate = 0, channels = 0;
    uint64_t size = 0;
    int64_t mtime = 0;
};

// Copies a song into a zeroed record (texts cut at a UTF-8 character boundary).
void MediaSongToInfo(const MediaSong &song, TARN_MEDIA_INFO *info);

// Reads the tags and audio properties of one file with TagLib. Returns 0 on
// success; -1 with the reason in *why (not readable, not an audio file of a
// known kind, no audio stream ...). Tag texts that are not valid UTF-8 are
// dropped (the title then falls back to the file name) and named in *warning.
int MediaReadTags(const std::string &path, MediaSong *song, std::string *why,
                  std::string *warning);

// One saved playlist.
struct MediaPlaylist {
    std::string path, title;
};

// A rule of a smart playlist: field op value [value2].
//   fields: title album artist genre path (texts); year track disc duration
//           bitrate (numbers)
//   ops:    is, isnot, contains, startswith (texts and numbers), from A to B,
//           above, below (numbers)
struct SmartRule {
    std::string field, op, value, value2;
};
struct SmartPlaylist {
    int64_t id = 0;
    std::string name;
    bool matchAny = false;  // false: every rule must match
    std::vector<SmartRule> rules;
};

// Parses one rule text such as "genre is Jazz", "year from 1990 to 1999",
// "artist contains Miles Davis" (the value is the rest of the text).
// Returns 0, or -1 with the reason in *why.
int SmartRuleParse(const std::string &text, SmartRule *rule, std::string *why);
std::string SmartRuleText(const SmartRule &rule);

// Summary of one scan.
struct ScanReport {
    int seen = 0;        // audio files found
    int added = 0;
    int updated = 0;
    int unchanged = 0;
    int removed = 0;
    int failed = 0;
    int playlists = 0;   // saved playlists in the library after the scan
    std::vector<std::string> failures;  // "path: reason"
    std::vector<std::string> warnings;  // "path: tag problem"
};

class MediaLib {
public:
    MediaLib();
    ~MediaLib();
    MediaLib(const MediaLib &) = delete;
    MediaLib &operator=(const MediaLib &) = delete;

    // Opens (create: creating when missing) the database and checks it.
    // Returns 0, or -1 with a message in LastError() (not a database, locked,
    // unreadable ...). Without create a missing file fails. readOnly opens
    // an existing library for reading only (clients that search and browse
    // it; no write access to the file needed).
    int Open(const std::string &path, bool create, bool readOnly = false);
    void Close();
    const std::string &LastError() const { return error_; }

    // Scans dir (recursively): new files are added, files whose size or mtime
    // changed are read again, songs below dir whose file is gone are removed;
    // the saved playlists below dir are refreshed the same way. Unreadable
    // files are counted in failed and the scan goes on. Files larger than
    // maxFileSize bytes are skipped as failures. progress(done, total) is
    // called while files are read. Returns 0, or -1 (database error) with
    // LastError() set and nothing changed.
    int Scan(const std::string &dir, ScanReport *report,
             const std::function<void(int done, int total)> &progress = nullptr,
             uint64_t maxFileSize = 1ull << 30);

    // Songs. Lookups return 1 found, 0 not found, -1 error.
    int SongCount();
    int FindById(uint32_t id, MediaSong *song);
    int FindByPath(const std::string &path, MediaSong *song);
    // All songs in library order (artist, album, disc, track, path).
    int ListSongs(std::vector<MediaSong> *songs, int start = 0, int limit = 0);
    // count distinct songs in random order (fewer when the library is smaller).
    int RandomSongs(int count, std::vector<MediaSong> *songs);

    // Saved playlists in library order (title, then path).
    int ListPlaylists(std::vector<MediaPlaylist> *lists);
    int FindPlaylist(const std::string &path, MediaPlaylist *list);  // 1/0/-1

    // Smart playlists in creation order.
    int ListSmart(std::vector<SmartPlaylist> *lists);
    int FindSmart(const std::string &name, SmartPlaylist *list);  // 1/0/-1
    // Creates or replaces the named smart playlist (rules are checked first).
    int SaveSmart(const SmartPlaylist &list);
    int DeleteSmart(const std::string &name);  // 1 deleted, 0 none, -1 error
    // Songs matching the rules, in library order; total := matches.
    int SmartSongs(const SmartPlaylist &list, std::vector<MediaSong> *songs, int start,
                   int limit, int *total);

private:
    int Exec(const char *sql);
    int Fail(const char *what);
    int SetupSchema();
    // The phases of Scan (medialib_scan.cpp), sharing one ScanState.
    struct ScanState;
    int ScanFindFiles(ScanState &st, ScanReport *report);
    int ScanReadKnown(ScanState &st);
    void ScanReadTags(ScanState &st, ScanReport *report,
                      const std::function<void(int, int)> &progress, uint64_t maxFileSize);
    int ScanWrite(ScanState &st, ScanReport *report);
    int ScanWriteSongs(ScanState &st, ScanReport *report);
    int ScanWritePlaylists(ScanState &st, ScanReport *report);
    int ScanRollback(const char *what);
    sqlite3 *db_ = nullptr;
    std::string path_;
    std::string error_;
};

// Reads an M3U/M3U8 file: title (#PLAYLIST, else the file name without
// extension) and the entries as absolute paths (relative ones resolved
// against the file's folder, file:// URLs decoded) with their #EXTINF titles.
struct M3uEntry {
    std::string path, title;
};
int M3uRead(const std::string &path, std::string *title, std::vector<M3uEntry> *entries);

#endif
