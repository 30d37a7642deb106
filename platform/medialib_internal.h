// Shared by the files of the media library (medialib.cpp, medialib_tags.cpp,
// medialib_m3u.cpp, medialib_smart.cpp, medialib_store.cpp,
// medialib_scan.cpp): text checks, the prepared statement and the song
// columns. Not for use outside platform/medialib*.
#ifndef TARN_PLATFORM_MEDIALIB_INTERNAL_H
#define TARN_PLATFORM_MEDIALIB_INTERNAL_H

#include <sqlite3.h>

#include <cstdint>
#include <string>

#include "platform/medialib.h"

namespace medialib_internal {

// The lower-case extension of a path ("" when it has none).
std::string LowerExt(const std::string &path);
// True when s is well-formed UTF-8.
bool ValidUtf8(const std::string &s);
// s without leading and trailing blanks and line ends.
std::string Trim(const std::string &s);

// A prepared statement that is finalised when it goes out of scope.
class Stmt {
public:
    Stmt(sqlite3 *db, const char *sql) { rc_ = sqlite3_prepare_v2(db, sql, -1, &st_, nullptr); }
    ~Stmt() { sqlite3_finalize(st_); }
    bool ok() const { return rc_ == SQLITE_OK && st_; }
    sqlite3_stmt *get() { return st_; }
    void Text(int i, const std::string &s) { sqlite3_bind_text(st_, i, s.data(), (int)s.size(), SQLITE_TRANSIENT); }
    void Int(int i, int64_t v) { sqlite3_bind_int64(st_, i, v); }
    void Real(int i, double v) { sqlite3_bind_double(st_, i, v); }
    int Step() { return sqlite3_step(st_); }
    void Reset() { sqlite3_reset(st_); sqlite3_clear_bindings(st_); }
    std::string Col(int i)
    {
        const unsigned char *t = sqlite3_column_text(st_, i);
        return t ? std::string((const char *)t, sqlite3_column_bytes(st_, i)) : std::string();
    }
    int64_t ColInt(int i) { return sqlite3_column_int64(st_, i); }
    double ColReal(int i) { return sqlite3_column_double(st_, i); }

private:
    sqlite3_stmt *st_ = nullptr;
    int rc_;
};

const char kSongColumns[] =
    "id, path, title, album, artist, genre, track, disc, year, duration, bitrate, samplerate, "
    "channels, size, mtime";
const char kSongOrder[] =
    " ORDER BY artist COLLATE NOCASE, album COLLATE NOCASE, disc, track, path";

inline void ReadSong(Stmt &s, MediaSong *song)
{
    song->id = (uint32_t)s.ColInt(0);
    song->path = s.Col(1);
    song->title = s.Col(2);
    song->album = s.Col(3);
    song->artist = s.Col(4);
    song->genre = s.Col(5);
    song->track = (int)s.ColInt(6);
    song->disc = (int)s.ColInt(7);
    song->year = (int)s.ColInt(8);
    song->duration = s.ColReal(9);
    song->bitrate = (int)s.ColInt(10);
    song->sampleRate = (int)s.ColInt(11);
    song->channels = (int)s.ColInt(12);
    song->size = (uint64_t)s.ColInt(13);
    song->mtime = s.ColInt(14);
}

}  // namespace medialib_internal

#endif
