// The media library's scan: what is on disk, what the library holds, the tags
// of new and changed files, and one transaction that writes the difference.
#include "platform/medialib.h"

#include <sys/stat.h>

#include <algorithm>
#include <filesystem>
#include <map>

#include "platform/medialib_internal.h"
#include "platform/tarn_log.h"

namespace fs = std::filesystem;
using namespace medialib_internal;

static const char kLogUnit[] = "medialib";

namespace {
struct OnDisk {
    uint64_t size;
    int64_t mtime;
};
}  // namespace

// What one scan has found so far, handed from phase to phase.
struct MediaLib::ScanState {
    fs::path root;
    std::string dir, lo, hi;
    std::map<std::string, OnDisk> audio, lists;        // on disk
    std::map<std::string, OnDisk> known, knownLists;   // in the library
    std::vector<std::string> toRead;                   // new and changed files
    std::vector<MediaSong> songs;                      // read from toRead
    std::vector<std::string> failedKnown;              // known files that became unreadable
};

int MediaLib::Scan(const std::string &dirIn, ScanReport *report,
                   const std::function<void(int, int)> &progress, uint64_t maxFileSize)
{
    *report = ScanReport();
    if (!db_) {
        error_ = "the media library is not open";
        return -1;
    }
    ScanState st;
    std::error_code ec;
    st.root = fs::canonical(dirIn, ec);
    if (ec || !fs::is_directory(st.root, ec)) {
        error_ = "cannot scan " + dirIn + ": not a readable folder";
        TLOG("%s", error_.c_str());
        return -1;
    }
    st.dir = st.root.string();
    st.lo = st.dir == "/" ? "/" : st.dir + "/";
    st.hi = st.dir == "/" ? "0" : st.dir + "0";  // '0' follows '/'

    if (ScanFindFiles(st, report) != 0 || ScanReadKnown(st) != 0)
        return -1;
    ScanReadTags(st, report, progress, maxFileSize);
    if (ScanWrite(st, report) != 0)
        return -1;
    Stmt c(db_, "SELECT count(*) FROM playlists");
    if (c.ok() && c.Step() == SQLITE_ROW)
        report->playlists = (int)c.ColInt(0);
    return 0;
}

// 1. What is on disk.
int MediaLib::ScanFindFiles(ScanState &st, ScanReport *report)
{
    std::error_code ec;
    fs::recursive_directory_iterator it(st.root, fs::directory_options::skip_permission_denied, ec), end;
    if (ec) {
        error_ = "cannot scan " + st.dir + ": " + ec.message();
        return -1;
    }
    for (; it != end; it.increment(ec)) {
        if (ec) {
            report->failed++;
            report->failures.push_back(it->path().string() + ": " + ec.message());
            ec.clear();
            continue;
        }
        const fs::directory_entry &de = *it;
        std::string p = de.path().string();
        bool isAudio = MediaLibIsAudioFile(p), isList = MediaLibIsPlaylistFile(p);
        if (!isAudio && !isList)
            continue;
        struct stat sb;
        if (stat(p.c_str(), &sb) != 0 || !S_ISREG(sb.st_mode))
            continue;
        if (!ValidUtf8(p)) {
            report->failed++;
            report->failures.push_back(p + ": file name is not valid UTF-8");
            continue;
        }
        (isAudio ? st.audio : st.lists)[p] = OnDisk{(uint64_t)sb.st_size, (int64_t)sb.st_mtime};
    }
    report->seen = (int)st.audio.size();
    return 0;
}

// 2. What the library holds below dir.
int MediaLib::ScanReadKnown(ScanState &st)
{
    Stmt s(db_, "SELECT path, size, mtime FROM songs WHERE path >= ? AND path < ?");
    if (!s.ok())
        return Fail("cannot read the media library");
    s.Text(1, st.lo);
    s.Text(2, st.hi);
    int rc;
    while ((rc = s.Step()) == SQLITE_ROW)
        st.known[s.Col(0)] = OnDisk{(uint64_t)s.ColInt(1), s.ColInt(2)};
    if (rc != SQLITE_DONE)
        return Fail("cannot read the media library");
    Stmt l(db_, "SELECT path, size, mtime FROM playlists WHERE path >= ? AND path < ?");
    if (!l.ok())
        return Fail("cannot read the media library");
    l.Text(1, st.lo);
    l.Text(2, st.hi);
    while ((rc = l.Step()) == SQLITE_ROW)
        st.knownLists[l.Col(0)] = OnDisk{(uint64_t)l.ColInt(1), l.ColInt(2)};
    if (rc != SQLITE_DONE)
        return Fail("cannot read the media library");
    return 0;
}

// 3. Read the tags of new and changed files (outside the transaction, so
// that readers are not held up by the slow part).
void MediaLib::ScanReadTags(ScanState &st, ScanReport *report,
                            const std::function<void(int, int)> &progress, uint64_t maxFileSize)
{
    for (const auto &kv : st.audio) {
        auto k = st.known.find(kv.first);
        if (k == st.known.end() || k->second.size != kv.second.size || k->second.mtime != kv.second.mtime)
            st.toRead.push_back(kv.first);
    }
    int total = (int)st.toRead.size();
    for (int i = 0; i < total; i++) {
        const std::string &p = st.toRead[i];
        MediaSong song;
        std::string why, warning;
        if (st.audio[p].size > maxFileSize) {
            why = "file too large (" + std::to_string(st.audio[p].size) + " bytes, limit " +
                  std::to_string(maxFileSize) + ")";
        } else if (MediaReadTags(p, &song, &why, &warning) == 0) {
            st.songs.push_back(song);
            if (!warning.empty())
                report->warnings.push_back(p + ": " + warning);
        }
        if (!why.empty()) {
            report->failed++;
            report->failures.push_back(p + ": " + why);
            if (st.known.count(p))
                st.failedKnown.push_back(p);
        }
        if (progress)
            progress(i + 1, total);
    }
}

// Records the failure, undoes the open transaction and returns -1.
int MediaLib::ScanRollback(const char *what)
{
    Fail(what);
    Exec("ROLLBACK");
    return -1;
}

// 4. Write everything in one transaction.
int MediaLib::ScanWrite(ScanState &st, ScanReport *report)
{
    if (Exec("BEGIN IMMEDIATE") != 0)
        return Fail("cannot start the library update");
    if (ScanWriteSongs(st, report) != 0 || ScanWritePlaylists(st, report) != 0)
        return -1;
    if (Exec("COMMIT") != 0)
        return ScanRollback("cannot save the library update");
    return 0;
}

// Songs: new and changed ones written, gone and broken ones deleted.
int MediaLib::ScanWriteSongs(ScanState &st, ScanReport *report)
{
    Stmt ins(db_,
             "INSERT INTO songs(path, title, album, artist, genre, track, disc, year, duration, bitrate,"
             " samplerate, channels, size, mtime) VALUES(?,?,?,?,?,?,?,?,?,?,?,?,?,?)"
             " ON CONFLICT(path) DO UPDATE SET title=excluded.title, album=excluded.album,"
             " artist=excluded.artist, genre=excluded.genre, track=excluded.track, disc=excluded.disc,"
             " year=excluded.year, duration=excluded.duration, bitrate=excluded.bitrate,"
             " samplerate=excluded.samplerate, channels=excluded.channels, size=excluded.size,"
             " mtime=excluded.mtime");
    if (!ins.ok())
        return ScanRollback("cannot update the media library");
    for (const MediaSong &s : st.songs) {
        ins.Text(1, s.path);
        ins.Text(2, s.title);
        ins.Text(3, s.album);
        ins.Text(4, s.artist);
        ins.Text(5, s.genre);
        ins.Int(6, s.track);
        ins.Int(7, s.disc);
        ins.Int(8, s.year);
        ins.Real(9, s.duration);
        ins.Int(10, s.bitrate);
        ins.Int(11, s.sampleRate);
        ins.Int(12, s.channels);
        ins.Int(13, (int64_t)s.size);
        ins.Int(14, s.mtime);
        if (ins.Step() != SQLITE_DONE)
            return ScanRollback("cannot update the media library");
        ins.Reset();
        if (st.known.count(s.path))
            report->updated++;
        else
            report->added++;
    }
    Stmt del(db_, "DELETE FROM songs WHERE path = ?");
    if (!del.ok())
        return ScanRollback("cannot update the media library");
    for (const auto &kv : st.known) {
        bool gone = !st.audio.count(kv.first);
        bool broken = std::find(st.failedKnown.begin(), st.failedKnown.end(), kv.first) != st.failedKnown.end();
        if (!gone && !broken)
            continue;
        del.Text(1, kv.first);
        if (del.Step() != SQLITE_DONE)
            return ScanRollback("cannot update the media library");
        del.Reset();
        if (gone)
            report->removed++;
    }
    report->unchanged = (int)(st.audio.size() - st.toRead.size());
    return 0;
}

// Saved playlists: new and changed ones read and written, gone ones deleted.
int MediaLib::ScanWritePlaylists(ScanState &st, ScanReport *report)
{
    Stmt pins(db_,
              "INSERT INTO playlists(path, title, size, mtime) VALUES(?,?,?,?)"
              " ON CONFLICT(path) DO UPDATE SET title=excluded.title, size=excluded.size, mtime=excluded.mtime");
    Stmt pdel(db_, "DELETE FROM playlists WHERE path = ?");
    if (!pins.ok() || !pdel.ok())
        return ScanRollback("cannot update the media library");
    for (const auto &kv : st.lists) {
        auto k = st.knownLists.find(kv.first);
        if (k != st.knownLists.end() && k->second.size == kv.second.size && k->second.mtime == kv.second.mtime)
            continue;
        std::string title;
        std::vector<M3uEntry> entries;
        if (M3uRead(kv.first, &title, &entries) != 0) {
            report->failed++;
            report->failures.push_back(kv.first + ": cannot read playlist");
            continue;
        }
        pins.Text(1, kv.first);
        pins.Text(2, title);
        pins.Int(3, (int64_t)kv.second.size);
        pins.Int(4, kv.second.mtime);
        if (pins.Step() != SQLITE_DONE)
            return ScanRollback("cannot update the media library");
        pins.Reset();
    }
    for (const auto &kv : st.knownLists) {
        if (st.lists.count(kv.first))
            continue;
        pdel.Text(1, kv.first);
        if (pdel.Step() != SQLITE_DONE)
            return ScanRollback("cannot update the media library");
        pdel.Reset();
    }
    return 0;
}
