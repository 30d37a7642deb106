// The media library as the remote sees it: browsing and search over a
// read-only connection, cover art, and rescans in the background.
#include <dirent.h>
#include <sys/stat.h>

#include <taglib/attachedpictureframe.h>
#include <taglib/flacfile.h>
#include <taglib/flacpicture.h>
#include <taglib/id3v2tag.h>
#include <taglib/mp4file.h>
#include <taglib/mpegfile.h>
#include <taglib/vorbisfile.h>
#include <taglib/xiphcomment.h>

#include <algorithm>
#include <chrono>
#include <cstring>
#include <fstream>
#include <sstream>

#include "platform/medialib.h"
#include "platform/tarn_log.h"
#include "tools/tarnweb/web_remote.h"

namespace {

const char kSongColumns[] =
    "id, path, title, album, artist, genre, track, disc, year, duration, bitrate, samplerate, channels, size";
const char kLibraryOrder[] =
    " ORDER BY artist COLLATE NOCASE, album COLLATE NOCASE, disc, track, path";

// One prepared statement, finalized when it goes.
class Stmt {
public:
    Stmt(sqlite3 *db, const std::string &sql)
    {
        if (sqlite3_prepare_v2(db, sql.c_str(), -1, &st, nullptr) != SQLITE_OK)
            st = nullptr;
    }
    ~Stmt() { sqlite3_finalize(st); }
    bool Ok() const { return st != nullptr; }
    void Bind(int i, const std::string &v) { sqlite3_bind_text(st, i, v.c_str(), -1, SQLITE_TRANSIENT); }
    void Bind(int i, int64_t v) { sqlite3_bind_int64(st, i, v); }
    int Step() { return sqlite3_step(st); }
    void Reset() { sqlite3_reset(st); }
    std::string Text(int i)
    {
        const unsigned char *t = sqlite3_column_text(st, i);
        return t ? std::string(reinterpret_cast<const char *>(t), static_cast<size_t>(sqlite3_column_bytes(st, i)))
                 : std::string();
    }
    int64_t Int(int i) { return sqlite3_column_int64(st, i); }
    double Real(int i) { return sqlite3_column_double(st, i); }

private:
    sqlite3_stmt *st = nullptr;
};

MediaSong SongRow(Stmt &s)
{
    MediaSong m;
    m.id = static_cast<uint32_t>(s.Int(0));
    m.path = s.Text(1);
    m.title = s.Text(2);
    m.album = s.Text(3);
    m.artist = s.Text(4);
    m.genre = s.Text(5);
    m.track = static_cast<int>(s.Int(6));
    m.disc = static_cast<int>(s.Int(7));
    m.year = static_cast<int>(s.Int(8));
    m.duration = s.Real(9);
    m.bitrate = static_cast<int>(s.Int(10));
    m.sampleRate = static_cast<int>(s.Int(11));
    m.channels = static_cast<int>(s.Int(12));
    m.size = static_cast<uint64_t>(s.Int(13));
    return m;
}

Json::Value SongJson(const MediaSong &m)
{
    Json::Value v(Json::objectValue);
    v["id"] = m.id;
    v["title"] = m.title.empty() ? m.path.substr(m.path.rfind('/') + 1) : m.title;
    v["artist"] = m.artist;
    v["album"] = m.album;
    v["genre"] = m.genre;
    v["track"] = m.track;
    v["year"] = m.year;
    v["duration"] = static_cast<int>(m.duration + 0.5);
    return v;
}

// LIKE pattern matching text anywhere, with % and _ taken literally.
std::string LikeAnywhere(const std::string &text)
{
    std::string out = "%";
    for (char c : text) {
        if (c == '%' || c == '_' || c == '\\')
            out += '\\';
        out += c;
    }
    return out + "%";
}

bool ReadFile(const std::string &path, std::string *data, size_t limit)
{
    std::ifstream in(path, std::ios::binary);
    if (!in)
        return false;
    std::stringstream ss;
    ss << in.rdbuf();
    *data = ss.str();
    return !data->empty() && data->size() <= limit;
}

std::string ImageType(const std::string &data)
{
    if (data.size() > 3 && static_cast<unsigned char>(data[0]) == 0xff && static_cast<unsigned char>(data[1]) == 0xd8)
        return "image/jpeg";
    if (data.size() > 8 && data.compare(1, 3, "PNG") == 0)
        return "image/png";
    if (data.size() > 12 && data.compare(0, 4, "RIFF") == 0 && data.compare(8, 4, "WEBP") == 0)
        return "image/webp";
    if (data.size() > 6 && data.compare(0, 3, "GIF") == 0)
        return "image/gif";
    return "";
}

bool Take(const TagLib::ByteVector &bytes, std::string *data, std::string *type)
{
    if (bytes.isEmpty())
        return false;
    *data = std::string(bytes.data(), bytes.size());
    *type = ImageType(*data);
    return !type->empty();
}

// The front cover (or any picture) embedded in the file.
bool EmbeddedCover(const std::string &path, std::string *data, std::string *type)
{
    std::string ext = path.substr(path.rfind('.') + 1);
    std::transform(ext.begin(), ext.end(), ext.begin(), ::tolower);
    if (ext == "mp3" || ext == "mp2" || ext == "mpa") {
        TagLib::MPEG::File f(path.c_str(), false);
        if (!f.isValid() || !f.ID3v2Tag())
            return false;
        const TagLib::ID3v2::FrameList &frames = f.ID3v2Tag()->frameListMap()["APIC"];
        const TagLib::ID3v2::AttachedPictureFrame *any = nullptr;
        for (auto *frame : frames) {
            auto *pic = dynamic_cast<const TagLib::ID3v2::AttachedPictureFrame *>(frame);
            if (!pic)
                continue;
            if (pic->type() == TagLib::ID3v2::AttachedPictureFrame::FrontCover)
                return Take(pic->picture(), data, type);
            if (!any)
                any = pic;
        }
        return any && Take(any->picture(), data, type);
    }
    if (ext == "flac") {
        TagLib::FLAC::File f(path.c_str(), false);
        if (!f.isValid())
            return false;
        for (auto *pic : f.pictureList())
            if (Take(pic->data(), data, type))
                return true;
        return false;
    }
    if (ext == "ogg" || ext == "oga") {
        TagLib::Vorbis::File f(path.c_str(), false);
        if (!f.isValid() || !f.tag())
            return false;
        for (auto *pic : f.tag()->pictureList())
            if (Take(pic->data(), data, type))
                return true;
        return false;
    }
    if (ext == "m4a" || ext == "m4b" || ext == "mp4" || ext == "aac") {
        TagLib::MP4::File f(path.c_str(), false);
        if (!f.isValid() || !f.tag() || !f.tag()->contains("covr"))
            return false;
        TagLib::MP4::CoverArtList covers = f.tag()->item("covr").toCoverArtList();
        for (auto &c : covers)
            if (Take(c.data(), data, type))
                return true;
    }
    return false;
}

}  // namespace

int WebCoverForFile(const std::string &path, std::string *data, std::string *type)
{
    if (EmbeddedCover(path, data, type))
        return 1;
    // A picture in the song's folder: the usual names first, then any.
    std::string dir = path.substr(0, path.rfind('/'));
    DIR *d = opendir(dir.c_str());
    if (!d)
        return 0;
    std::vector<std::string> images;
    while (struct dirent *e = readdir(d)) {
        std::string name = e->d_name, lower = name;
        std::transform(lower.begin(), lower.end(), lower.begin(), ::tolower);
        size_t dot = lower.rfind('.');
        if (dot == std::string::npos || name[0] == '.')
            continue;
        std::string ext = lower.substr(dot + 1), stem = lower.substr(0, dot);
        if (ext != "jpg" && ext != "jpeg" && ext != "png" && ext != "webp")
            continue;
        static const char *preferred[] = {"cover", "folder", "front", "album", "albumart"};
        bool first = std::find(std::begin(preferred), std::end(preferred), stem) != std::end(preferred);
        images.insert(first ? images.begin() : images.end(), name);
    }
    closedir(d);
    for (const std::string &name : images)
        if (ReadFile(dir + "/" + name, data, 8u << 20) && !(*type = ImageType(*data)).empty())
            return 1;
    return 0;
}

LibraryView::LibraryView(const std::string &path) : dbPath(path)
{
    scanState["running"] = false;
}

LibraryView::~LibraryView()
{
    if (scanner.joinable())
        scanner.join();
    if (db)
        sqlite3_close(db);
}

int LibraryView::OpenLocked(std::string *error)
{
    if (db)
        return 0;
    if (sqlite3_open_v2(dbPath.c_str(), &db, SQLITE_OPEN_READONLY | SQLITE_OPEN_NOMUTEX, nullptr) != SQLITE_OK) {
        if (error)
            *error = "the media library cannot be read (" + dbPath + "): " + (db ? sqlite3_errmsg(db) : "");
        sqlite3_close(db);
        db = nullptr;
        return -1;
    }
    sqlite3_busy_timeout(db, 3000);
    return 0;
}

#define LIBRARY_QUERY(stmt, sql)                                             \
    std::lock_guard<std::mutex> lock(mutex);                                 \
    if (OpenLocked(error) != 0)                                              \
        return -1;                                                           \
    Stmt stmt(db, sql);                                                      \
    if (!stmt.Ok()) {                                                        \
        *error = std::string("the media library cannot be read: ") + sqlite3_errmsg(db); \
        sqlite3_close(db);                                                   \
        db = nullptr;                                                        \
        return -1;                                                           \
    }

int LibraryView::Artists(Json::Value *out, std::string *error)
{
    LIBRARY_QUERY(s, "SELECT artist, COUNT(DISTINCT album COLLATE NOCASE), COUNT(*) FROM songs"
                     " GROUP BY artist COLLATE NOCASE ORDER BY artist COLLATE NOCASE");
    *out = Json::Value(Json::arrayValue);
    while (s.Step() == SQLITE_ROW) {
        Json::Value a(Json::objectValue);
        a["name"] = s.Text(0);
        a["albums"] = static_cast<Json::Int64>(s.Int(1));
        a["songs"] = static_cast<Json::Int64>(s.Int(2));
        out->append(a);
    }
    return 0;
}

int LibraryView::Albums(const std::string &artist, bool byArtist, Json::Value *out, std::string *error)
{
    LIBRARY_QUERY(s, std::string("SELECT album, MIN(artist), COUNT(DISTINCT artist COLLATE NOCASE), COUNT(*),"
                                 " MAX(year), MIN(id) FROM songs") +
                         (byArtist ? " WHERE artist = ?1 COLLATE NOCASE" : "") +
                         " GROUP BY album COLLATE NOCASE ORDER BY album COLLATE NOCASE");
    if (byArtist)
        s.Bind(1, artist);
    *out = Json::Value(Json::arrayValue);
    while (s.Step() == SQLITE_ROW) {
        Json::Value a(Json::objectValue);
        a["name"] = s.Text(0);
        a["artist"] = s.Int(2) > 1 ? std::string("Various artists") : s.Text(1);
        a["songs"] = static_cast<Json::Int64>(s.Int(3));
        a["year"] = static_cast<Json::Int64>(s.Int(4));
        a["cover"] = "/api/cover/" + std::to_string(s.Int(5));
        out->append(a);
    }
    return 0;
}

int LibraryView::Songs(const std::string &artist, bool byArtist, const std::string &album, bool byAlbum,
                       int start, int limit, Json::Value *out, std::string *error)
{
    std::string where;
    if (byArtist)
        where += " WHERE artist = ?1 COLLATE NOCASE";
    if (byAlbum)
        where += std::string(byArtist ? " AND" : " WHERE") + " album = ?2 COLLATE NOCASE";
    LIBRARY_QUERY(s, std::string("SELECT ") + kSongColumns + ", COUNT(*) OVER () FROM songs" + where +
                         kLibraryOrder + " LIMIT ?3 OFFSET ?4");
    if (byArtist)
        s.Bind(1, artist);
    if (byAlbum)
        s.Bind(2, album);
    s.Bind(3, static_cast<int64_t>(limit > 0 ? limit : 500));
    s.Bind(4, static_cast<int64_t>(start > 0 ? start : 0));
    (*out)["songs"] = Json::Value(Json::arrayValue);
    (*out)["total"] = 0;
    (*out)["start"] = start;
    while (s.Step() == SQLITE_ROW) {
        (*out)["songs"].append(SongJson(SongRow(s)));
        (*out)["total"] = static_cast<Json::Int64>(s.Int(14));
    }
    return 0;
}

int LibraryView::Search(const std::string &query, const std::string &field, int limit, Json::Value *out,
                        std::string *error)
{
    std::string where;
    if (field == "artist" || field == "album" || field == "title")
        where = field + " LIKE ?1 ESCAPE '\\'";
    else
        where = "(title LIKE ?1 ESCAPE '\\' OR artist LIKE ?1 ESCAPE '\\' OR album LIKE ?1 ESCAPE '\\'"
                " OR genre LIKE ?1 ESCAPE '\\')";
    LIBRARY_QUERY(s, std::string("SELECT ") + kSongColumns + ", COUNT(*) OVER () FROM songs WHERE " + where +
                         kLibraryOrder + " LIMIT ?2");
    s.Bind(1, LikeAnywhere(query));
    s.Bind(2, static_cast<int64_t>(limit > 0 ? limit : 200));
    (*out)["songs"] = Json::Value(Json::arrayValue);
    (*out)["total"] = 0;
    while (s.Step() == SQLITE_ROW) {
        (*out)["songs"].append(SongJson(SongRow(s)));
        (*out)["total"] = static_cast<Json::Int64>(s.Int(14));
    }
    return 0;
}

int LibraryView::SongsById(const std::vector<uint32_t> &ids, std::vector<MediaSong> *out, std::string *error)
{
    LIBRARY_QUERY(s, std::string("SELECT ") + kSongColumns + " FROM songs WHERE id = ?1");
    for (uint32_t id : ids) {
        s.Reset();
        s.Bind(1, static_cast<int64_t>(id));
        if (s.Step() == SQLITE_ROW)
            out->push_back(SongRow(s));
    }
    return 0;
}

int LibraryView::IdByPath(const std::string &path, uint32_t *id)
{
    std::string ignored, *error = &ignored;
    LIBRARY_QUERY(s, "SELECT id FROM songs WHERE path = ?1");
    s.Bind(1, path);
    if (s.Step() != SQLITE_ROW)
        return 0;
    *id = static_cast<uint32_t>(s.Int(0));
    return 1;
}

int LibraryView::Cover(uint32_t id, std::string *data, std::string *type, std::string *etag)
{
    std::string path;
    {
        std::string ignored, *error = &ignored;
        LIBRARY_QUERY(s, "SELECT path, mtime, size FROM songs WHERE id = ?1");
        s.Bind(1, static_cast<int64_t>(id));
        if (s.Step() != SQLITE_ROW)
            return 0;
        path = s.Text(0);
        *etag = "\"" + std::to_string(id) + "-" + std::to_string(s.Int(1)) + "-" + std::to_string(s.Int(2)) + "\"";
    }
    return WebCoverForFile(path, data, type);
}

std::string LibraryView::SongFolder()
{
    std::vector<std::string> dirs;
    {
        std::lock_guard<std::mutex> lock(mutex);
        if (OpenLocked(nullptr) != 0)
            return "";
        Stmt s(db, "SELECT DISTINCT rtrim(path, replace(path, '/', '')) FROM songs");
        while (s.Ok() && s.Step() == SQLITE_ROW)
            dirs.push_back(s.Text(0));
    }
    if (dirs.empty())
        return "";
    // The longest folder that holds them all.
    std::string common = dirs[0];
    for (const std::string &d : dirs) {
        size_t n = 0;
        while (n < common.size() && n < d.size() && common[n] == d[n])
            ++n;
        common = common.substr(0, n);
    }
    common = common.substr(0, common.rfind('/'));
    return common.empty() ? "/" : common;
}

int LibraryView::StartScan(const std::vector<std::string> &folders,
                           std::function<void(const Json::Value &)> progress)
{
    std::lock_guard<std::mutex> lock(scanMutex);
    if (scanning)
        return -1;
    if (scanner.joinable())
        scanner.join();
    scanning = true;
    scanState = Json::Value(Json::objectValue);
    scanState["running"] = true;
    std::string names;
    for (const std::string &f : folders)
        names += (names.empty() ? "" : ":") + f;
    scanState["folder"] = names;
    scanState["done"] = 0;
    scanState["total"] = 0;
    std::string path = dbPath;
    scanner = std::thread([this, folders, names, path, progress] {
        MediaLib lib;
        ScanReport report, total;
        Json::Value state(Json::objectValue);
        state["folder"] = names;
        int r = lib.Open(path, true);
        int64_t lastSent = 0;
        // One folder after the other, as tarnlib scan does.
        for (size_t i = 0; r == 0 && i < folders.size(); ++i) {
            report = ScanReport();
            r = lib.Scan(folders[i], &report, [&](int done, int total) {
                int64_t now = std::chrono::duration_cast<std::chrono::milliseconds>(
                                  std::chrono::steady_clock::now().time_since_epoch())
                                  .count();
                Json::Value p = state;
                p["running"] = true;
                p["done"] = done;
                p["total"] = total;
                {
                    std::lock_guard<std::mutex> lock(scanMutex);
                    scanState = p;
                }
                // At most 4 messages a second reach the pages.
                if (now - lastSent >= 250 || done == total) {
                    lastSent = now;
                    progress(p);
                }
            });
            total.seen += report.seen;
            total.added += report.added;
            total.updated += report.updated;
            total.removed += report.removed;
            total.failed += report.failed;
        }
        report = total;
        state["running"] = false;
        state["ok"] = r == 0;
        if (r != 0)
            state["error"] = lib.LastError().empty() ? "the scan failed" : lib.LastError();
        state["done"] = report.seen;
        state["total"] = report.seen;
        state["added"] = report.added;
        state["updated"] = report.updated;
        state["removed"] = report.removed;
        state["failed"] = report.failed;
        {
            std::lock_guard<std::mutex> lock(scanMutex);
            scanState = state;
            scanning = false;
        }
        progress(state);
    });
    return 0;
}

Json::Value LibraryView::ScanState()
{
    std::lock_guard<std::mutex> lock(scanMutex);
    return scanState;
}
