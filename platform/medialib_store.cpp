// The media library's SQLite store: opening and checking the database, its
// schema, and the song and saved-playlist queries.
#include "platform/medialib.h"

#include <unistd.h>

#include <filesystem>

#include "platform/medialib_internal.h"
#include "platform/tarn_log.h"

namespace fs = std::filesystem;
using namespace medialib_internal;

static const char kLogUnit[] = "medialib";
static const int kSchemaVersion = 1;
static const int kApplicationId = 0x5441524E;  // "TARN"

MediaLib::MediaLib() {}
MediaLib::~MediaLib() { Close(); }

void MediaLib::Close()
{
    if (db_)
        sqlite3_close_v2(db_);
    db_ = nullptr;
}

int MediaLib::Fail(const char *what)
{
    int code = db_ ? sqlite3_errcode(db_) : SQLITE_ERROR;
    std::string msg = db_ ? sqlite3_errmsg(db_) : "no database";
    error_ = std::string(what) + ": " + msg;
    if (code == SQLITE_NOTADB || code == SQLITE_CORRUPT)
        error_ += " - the library database " + path_ +
                  " is damaged; move it aside and run \"tarnlib scan DIR\" to rebuild it";
    else if (code == SQLITE_BUSY || code == SQLITE_LOCKED)
        error_ += " - another process holds the library database " + path_ + "; try again later";
    else if (code == SQLITE_READONLY || code == SQLITE_CANTOPEN || code == SQLITE_PERM)
        error_ += " - check the permissions of " + path_ + " and its folder";
    TLOG("%s", error_.c_str());
    return -1;
}

int MediaLib::Exec(const char *sql)
{
    char *msg = nullptr;
    int rc = sqlite3_exec(db_, sql, nullptr, nullptr, &msg);
    sqlite3_free(msg);
    return rc == SQLITE_OK ? 0 : -1;
}

int MediaLib::Open(const std::string &path, bool create, bool readOnly)
{
    if (readOnly)
        create = false;
    Close();
    path_ = path;
    error_.clear();
    if (!create && access(path.c_str(), F_OK) != 0) {
        error_ = "no media library at " + path + " (run \"tarnlib scan DIR\" to create it)";
        TLOG("%s", error_.c_str());
        return -1;
    }
    if (create) {
        std::error_code ec;
        fs::create_directories(fs::path(path).parent_path(), ec);
    }
    int flags = (readOnly ? SQLITE_OPEN_READONLY : SQLITE_OPEN_READWRITE) | SQLITE_OPEN_NOMUTEX |
                (create ? SQLITE_OPEN_CREATE : 0);
    if (sqlite3_open_v2(path.c_str(), &db_, flags, nullptr) != SQLITE_OK)
        return Fail("cannot open the media library"), Close(), -1;
    sqlite3_busy_timeout(db_, 5000);
    sqlite3_extended_result_codes(db_, 0);
    if (readOnly) {
        Stmt v(db_, "PRAGMA application_id");
        if (!v.ok() || v.Step() != SQLITE_ROW)
            return Fail("cannot read the media library"), Close(), -1;
        if (v.ColInt(0) != kApplicationId) {
            error_ = path_ + " is not a media library (run \"tarnlib scan DIR\" to create one)";
            TLOG("%s", error_.c_str());
            Close();
            return -1;
        }
        return 0;
    }
    if (Exec("PRAGMA journal_mode=WAL") != 0 || Exec("PRAGMA foreign_keys=ON") != 0 ||
        Exec("PRAGMA synchronous=NORMAL") != 0) {
        Fail("cannot open the media library");
        Close();
        return -1;
    }
    if (SetupSchema() != 0) {
        Close();
        return -1;
    }
    return 0;
}

int MediaLib::SetupSchema()
{
    Stmt q(db_, "PRAGMA application_id");
    if (!q.ok() || q.Step() != SQLITE_ROW)
        return Fail("cannot read the media library");
    int64_t appId = q.ColInt(0);
    Stmt t(db_, "SELECT count(*) FROM sqlite_master");
    if (!t.ok() || t.Step() != SQLITE_ROW)
        return Fail("cannot read the media library");
    int64_t objects = t.ColInt(0);
    if (objects > 0 && appId != kApplicationId) {
        error_ = path_ + " is an SQLite database but not a media library; move it aside or choose another file";
        TLOG("%s", error_.c_str());
        return -1;
    }
    if (objects > 0) {
        Stmt v(db_, "PRAGMA user_version");
        if (!v.ok() || v.Step() != SQLITE_ROW)
            return Fail("cannot read the media library");
        if (v.ColInt(0) > kSchemaVersion) {
            error_ = path_ + " was written by a newer version of the media library";
            TLOG("%s", error_.c_str());
            return -1;
        }
        return 0;
    }
    static const char kSchema[] =
        "BEGIN IMMEDIATE;"
        "CREATE TABLE IF NOT EXISTS songs(id INTEGER PRIMARY KEY AUTOINCREMENT, path TEXT NOT NULL UNIQUE,"
        " title TEXT NOT NULL DEFAULT '', album TEXT NOT NULL DEFAULT '', artist TEXT NOT NULL DEFAULT '',"
        " genre TEXT NOT NULL DEFAULT '', track INTEGER NOT NULL DEFAULT 0, disc INTEGER NOT NULL DEFAULT 0,"
        " year INTEGER NOT NULL DEFAULT 0, duration REAL NOT NULL DEFAULT 0, bitrate INTEGER NOT NULL DEFAULT 0,"
        " samplerate INTEGER NOT NULL DEFAULT 0, channels INTEGER NOT NULL DEFAULT 0,"
        " size INTEGER NOT NULL DEFAULT 0, mtime INTEGER NOT NULL DEFAULT 0);"
        "CREATE TABLE IF NOT EXISTS playlists(path TEXT PRIMARY KEY, title TEXT NOT NULL,"
        " size INTEGER NOT NULL DEFAULT 0, mtime INTEGER NOT NULL DEFAULT 0);"
        "CREATE TABLE IF NOT EXISTS smart(id INTEGER PRIMARY KEY AUTOINCREMENT, name TEXT NOT NULL UNIQUE,"
        " match_any INTEGER NOT NULL DEFAULT 0);"
        "CREATE TABLE IF NOT EXISTS smart_rules(smart_id INTEGER NOT NULL REFERENCES smart(id) ON DELETE CASCADE,"
        " seq INTEGER NOT NULL, field TEXT NOT NULL, op TEXT NOT NULL, value TEXT NOT NULL,"
        " value2 TEXT NOT NULL DEFAULT '');"
        "CREATE INDEX IF NOT EXISTS songs_artist ON songs(artist COLLATE NOCASE, album COLLATE NOCASE);"
        "PRAGMA application_id=1413567054;"
        "PRAGMA user_version=1;"
        "COMMIT;";
    static_assert(kApplicationId == 1413567054, "application id");
    if (Exec(kSchema) != 0) {
        Fail("cannot create the media library");
        Exec("ROLLBACK");
        return -1;
    }
    return 0;
}

int MediaLib::SongCount()
{
    if (!db_)
        return -1;
    Stmt s(db_, "SELECT count(*) FROM songs");
    if (!s.ok() || s.Step() != SQLITE_ROW)
        return Fail("cannot read the media library");
    return (int)s.ColInt(0);
}

int MediaLib::FindById(uint32_t id, MediaSong *song)
{
    if (!db_)
        return -1;
    std::string sql = std::string("SELECT ") + kSongColumns + " FROM songs WHERE id = ?";
    Stmt s(db_, sql.c_str());
    if (!s.ok())
        return Fail("cannot read the media library");
    s.Int(1, id);
    int rc = s.Step();
    if (rc == SQLITE_ROW) {
        ReadSong(s, song);
        return 1;
    }
    return rc == SQLITE_DONE ? 0 : Fail("cannot read the media library");
}

int MediaLib::FindByPath(const std::string &path, MediaSong *song)
{
    if (!db_)
        return -1;
    std::string sql = std::string("SELECT ") + kSongColumns + " FROM songs WHERE path = ?";
    Stmt s(db_, sql.c_str());
    if (!s.ok())
        return Fail("cannot read the media library");
    s.Text(1, path);
    int rc = s.Step();
    if (rc == SQLITE_ROW) {
        ReadSong(s, song);
        return 1;
    }
    return rc == SQLITE_DONE ? 0 : Fail("cannot read the media library");
}

int MediaLib::ListSongs(std::vector<MediaSong> *songs, int start, int limit)
{
    songs->clear();
    if (!db_)
        return -1;
    std::string sql = std::string("SELECT ") + kSongColumns + " FROM songs" + kSongOrder + " LIMIT ? OFFSET ?";
    Stmt s(db_, sql.c_str());
    if (!s.ok())
        return Fail("cannot read the media library");
    s.Int(1, limit > 0 ? limit : -1);
    s.Int(2, start > 0 ? start : 0);
    int rc;
    while ((rc = s.Step()) == SQLITE_ROW) {
        songs->emplace_back();
        ReadSong(s, &songs->back());
    }
    return rc == SQLITE_DONE ? 0 : Fail("cannot read the media library");
}

int MediaLib::RandomSongs(int count, std::vector<MediaSong> *songs)
{
    songs->clear();
    if (!db_)
        return -1;
    // Shuffles the ids only, then reads the chosen rows.
    std::string sql = std::string("SELECT ") + kSongColumns +
                      " FROM songs WHERE id IN (SELECT id FROM songs ORDER BY random() LIMIT ?) ORDER BY random()";
    Stmt s(db_, sql.c_str());
    if (!s.ok())
        return Fail("cannot read the media library");
    s.Int(1, count);
    int rc;
    while ((rc = s.Step()) == SQLITE_ROW) {
        songs->emplace_back();
        ReadSong(s, &songs->back());
    }
    return rc == SQLITE_DONE ? 0 : Fail("cannot read the media library");
}

int MediaLib::ListPlaylists(std::vector<MediaPlaylist> *lists)
{
    lists->clear();
    if (!db_)
        return -1;
    Stmt s(db_, "SELECT path, title FROM playlists ORDER BY title COLLATE NOCASE, path");
    if (!s.ok())
        return Fail("cannot read the media library");
    int rc;
    while ((rc = s.Step()) == SQLITE_ROW)
        lists->push_back(MediaPlaylist{s.Col(0), s.Col(1)});
    return rc == SQLITE_DONE ? 0 : Fail("cannot read the media library");
}

int MediaLib::FindPlaylist(const std::string &path, MediaPlaylist *list)
{
    if (!db_)
        return -1;
    Stmt s(db_, "SELECT path, title FROM playlists WHERE path = ?");
    if (!s.ok())
        return Fail("cannot read the media library");
    s.Text(1, path);
    int rc = s.Step();
    if (rc == SQLITE_ROW) {
        *list = MediaPlaylist{s.Col(0), s.Col(1)};
        return 1;
    }
    return rc == SQLITE_DONE ? 0 : Fail("cannot read the media library");
}
