// Media library database and scanner: real tagged files of several formats,
// incremental rescans, damaged files and tags, damaged and locked databases.
#include <gtest/gtest.h>
#include <sqlite3.h>
#include <taglib/id3v2framefactory.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <sstream>

#include "platform/medialib.h"
#include "tests/unit/medialib_songs.h"

namespace fs = std::filesystem;
using medialibtest::MakeSong;
using medialibtest::Tags;

namespace {

class ScanTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        char tmpl[] = "/tmp/medialib-scan.XXXXXX";
        ASSERT_NE(nullptr, mkdtemp(tmpl));
        dir = tmpl;
        music = dir + "/music";
        cache = dir + "/cache";
        db = dir + "/var/medialib.db";
        fs::create_directories(music);
    }
    void TearDown() override
    {
        std::error_code ec;
        fs::remove_all(dir, ec);
    }
    void Song(const std::string &rel, const Tags &t)
    {
        ASSERT_TRUE(MakeSong(cache, music + "/" + rel, t)) << rel;
    }
    static void WriteText(const std::string &path, const std::string &text)
    {
        fs::create_directories(fs::path(path).parent_path());
        std::ofstream(path, std::ios::binary) << text;
    }
    // Replaces the bytes `from` by `to` (same length) inside a file.
    static void Patch(const std::string &path, const std::string &from, const std::string &to)
    {
        std::ifstream in(path, std::ios::binary);
        std::stringstream ss;
        ss << in.rdbuf();
        std::string data = ss.str();
        size_t at = data.find(from);
        ASSERT_NE(std::string::npos, at) << "pattern not in " << path;
        data.replace(at, from.size(), to);
        std::ofstream(path, std::ios::binary | std::ios::trunc) << data;
    }
    static bool HasEntry(const std::vector<std::string> &list, const std::string &needle)
    {
        return std::any_of(list.begin(), list.end(),
                           [&](const std::string &s) { return s.find(needle) != std::string::npos; });
    }
    std::string dir, music, cache, db;
};

TEST_F(ScanTest, ReadsTagsAndPropertiesOfEveryFormat)
{
    Song("Jazz/blue.mp3", {"Blue in Green", "Miles", "Kind of Blue", "Jazz", 1959, 3});
    Song("Rock/loud.flac", {"Loud Song", "The Band", "Noise", "Rock", 1999, 7});
    Song("misc/calm.ogg", {"Calm \xC3\xA9t\xC3\xA9", "Ann", "Sea", "Ambient", 2005, 1});
    Song("misc/plain.wav", {"Plain Wave", "Wav Artist", "", "", 2010, 2});
    MediaLib lib;
    ASSERT_EQ(0, lib.Open(db, true)) << lib.LastError();
    ScanReport r;
    int calls = 0, lastDone = 0, lastTotal = 0;
    ASSERT_EQ(0, lib.Scan(music, &r, [&](int d, int t) { calls++, lastDone = d, lastTotal = t; }))
        << lib.LastError();
    EXPECT_EQ(4, r.seen);
    EXPECT_EQ(4, r.added);
    EXPECT_EQ(0, r.failed) << (r.failures.empty() ? "" : r.failures[0]);
    EXPECT_EQ(4, calls);
    EXPECT_EQ(4, lastDone);
    EXPECT_EQ(4, lastTotal);
    EXPECT_EQ(4, lib.SongCount());

    std::string canon = fs::canonical(music).string();
    MediaSong s;
    ASSERT_EQ(1, lib.FindByPath(canon + "/Jazz/blue.mp3", &s));
    EXPECT_EQ("Blue in Green", s.title);
    EXPECT_EQ("Miles", s.artist);
    EXPECT_EQ("Kind of Blue", s.album);
    EXPECT_EQ("Jazz", s.genre);
    EXPECT_EQ(1959, s.year);
    EXPECT_EQ(3, s.track);
    EXPECT_EQ(22050, s.sampleRate);
    EXPECT_EQ(1, s.channels);
    EXPECT_GT(s.bitrate, 0);
    EXPECT_NEAR(0.3, s.duration, 0.1);
    EXPECT_EQ(fs::file_size(canon + "/Jazz/blue.mp3"), s.size);
    EXPECT_NE(0u, s.id);

    MediaSong byId;
    ASSERT_EQ(1, lib.FindById(s.id, &byId));
    EXPECT_EQ(s.path, byId.path);
    EXPECT_EQ(0, lib.FindById(999999, &byId));

    ASSERT_EQ(1, lib.FindByPath(canon + "/misc/calm.ogg", &s));
    EXPECT_EQ("Calm \xC3\xA9t\xC3\xA9", s.title);
    ASSERT_EQ(1, lib.FindByPath(canon + "/Rock/loud.flac", &s));
    EXPECT_EQ("Loud Song", s.title);
    EXPECT_EQ(7, s.track);
    ASSERT_EQ(1, lib.FindByPath(canon + "/misc/plain.wav", &s));
    EXPECT_EQ("Plain Wave", s.title);

    // The song record handed to the daemon.
    TARN_MEDIA_INFO info;
    memset(&info, 0x55, sizeof(info));
    MediaSongToInfo(s, &info);
    EXPECT_STREQ("Plain Wave", info.title);
    EXPECT_STREQ((canon + "/misc/plain.wav").c_str(), info.path);
    EXPECT_EQ(s.id, info.id);
    EXPECT_EQ(2010, info.year);
    EXPECT_EQ(0, info.albumArtUrl[0]);
    EXPECT_EQ(0, info.reserved4[100]);

    // Library order: artist, album, disc, track, path.
    std::vector<MediaSong> all;
    ASSERT_EQ(0, lib.ListSongs(&all));
    ASSERT_EQ(4u, all.size());
    EXPECT_EQ("Ann", all[0].artist);
    EXPECT_EQ("Wav Artist", all[3].artist);
}

TEST_F(ScanTest, RescanAddsUpdatesAndRemoves)
{
    Song("a.mp3", {"A", "X", "", "Pop", 2000, 1});
    Song("b.flac", {"B", "X", "", "Pop", 2000, 2});
    Song("c.ogg", {"C", "X", "", "Pop", 2000, 3});
    MediaLib lib;
    ASSERT_EQ(0, lib.Open(db, true)) << lib.LastError();
    ScanReport r;
    ASSERT_EQ(0, lib.Scan(music, &r));
    EXPECT_EQ(3, r.added);
    std::string canon = fs::canonical(music).string();
    MediaSong before;
    ASSERT_EQ(1, lib.FindByPath(canon + "/b.flac", &before));

    // Nothing changed: nothing is read again.
    int reads = 0;
    ASSERT_EQ(0, lib.Scan(music, &r, [&](int, int) { reads++; }));
    EXPECT_EQ(0, reads);
    EXPECT_EQ(3, r.unchanged);
    EXPECT_EQ(0, r.added + r.updated + r.removed + r.failed);

    // New tags on b (new size and mtime), c deleted, d added.
    Song("b.flac", {"B2 retitled", "Y", "", "Rock", 2001, 2});
    fs::last_write_time(music + "/b.flac", fs::file_time_type::clock::now() + std::chrono::seconds(5));
    fs::remove(music + "/c.ogg");
    Song("sub/d.mp3", {"D", "X", "", "Pop", 2000, 4});
    ASSERT_EQ(0, lib.Scan(music, &r));
    EXPECT_EQ(1, r.added);
    EXPECT_EQ(1, r.updated);
    EXPECT_EQ(1, r.removed);
    EXPECT_EQ(1, r.unchanged);
    EXPECT_EQ(3, lib.SongCount());
    MediaSong after;
    ASSERT_EQ(1, lib.FindByPath(canon + "/b.flac", &after));
    EXPECT_EQ("B2 retitled", after.title);
    EXPECT_EQ("Rock", after.genre);
    EXPECT_EQ(before.id, after.id) << "an updated song keeps its id";
    EXPECT_EQ(0, lib.FindByPath(canon + "/c.ogg", &after));

    // Scanning another folder leaves the songs of the first one alone.
    std::string other = dir + "/other";
    ASSERT_TRUE(MakeSong(cache, other + "/e.mp3", {"E", "Z", "", "Pop", 2000, 1}));
    ASSERT_EQ(0, lib.Scan(other, &r));
    EXPECT_EQ(1, r.added);
    EXPECT_EQ(0, r.removed);
    EXPECT_EQ(4, lib.SongCount());
}

TEST_F(ScanTest, DamagedFilesAndTagsAreReportedAndSkipped)
{
    Song("good.mp3", {"Good", "A", "", "", 0, 0});
    WriteText(music + "/text.mp3", "this is not audio at all\n");
    WriteText(music + "/empty.flac", "");
    // A FLAC file cut after its header.
    Song("cut.flac", {"Cut", "A", "", "", 0, 0});
    fs::resize_file(music + "/cut.flac", 20);
    // Tags whose bytes are not UTF-8: a Vorbis comment and an ID3v2.4 frame.
    Song("badtag.flac", {"BadXXTitle", "Fine Artist", "", "", 0, 0});
    Patch(music + "/badtag.flac", "BadXXTitle", "Bad\xff\xfeTitle");
    TagLib::ID3v2::FrameFactory::instance()->setDefaultTextEncoding(TagLib::String::UTF8);
    Song("badtag.mp3", {"Fine Title", "ArtYYist", "", "", 0, 0});
    TagLib::ID3v2::FrameFactory::instance()->setDefaultTextEncoding(TagLib::String::Latin1);
    Patch(music + "/badtag.mp3", "ArtYYist", "Art\xc3\x28ist");
    // A file over the size limit.
    Song("big.ogg", {"Big", "A", "", "", 0, 0});
    fs::resize_file(music + "/big.ogg", 200000);
    const uint64_t limit = 100000;
    for (const char *f : {"/good.mp3", "/badtag.mp3", "/badtag.flac"})
        ASSERT_LT(fs::file_size(music + f), limit);

    MediaLib lib;
    ASSERT_EQ(0, lib.Open(db, true)) << lib.LastError();
    ScanReport r;
    ASSERT_EQ(0, lib.Scan(music, &r, nullptr, limit));
    EXPECT_EQ(7, r.seen);
    EXPECT_EQ(3, r.added);
    EXPECT_EQ(4, r.failed) << testing::PrintToString(r.failures);
    EXPECT_TRUE(HasEntry(r.failures, "text.mp3: ")) << testing::PrintToString(r.failures);
    EXPECT_TRUE(HasEntry(r.failures, "empty.flac: "));
    EXPECT_TRUE(HasEntry(r.failures, "cut.flac: "));
    EXPECT_TRUE(HasEntry(r.failures, "big.ogg: file too large"));
    EXPECT_TRUE(HasEntry(r.warnings, "badtag.flac: tag text is not valid UTF-8, dropped: TITLE"))
        << testing::PrintToString(r.warnings);
    EXPECT_TRUE(HasEntry(r.warnings, "badtag.mp3: tag text is not valid UTF-8, dropped: TPE1"))
        << testing::PrintToString(r.warnings);

    std::string canon = fs::canonical(music).string();
    MediaSong s;
    ASSERT_EQ(1, lib.FindByPath(canon + "/badtag.flac", &s));
    EXPECT_EQ("badtag", s.title) << "a dropped title falls back to the file name";
    EXPECT_EQ("Fine Artist", s.artist);
    ASSERT_EQ(1, lib.FindByPath(canon + "/badtag.mp3", &s));
    EXPECT_EQ("Fine Title", s.title);
    EXPECT_EQ("ArtYYist", s.artist) << "the intact ID3v1 copy of the tag is used";

    // A song that turns bad is taken out of the library.
    WriteText(music + "/good.mp3", "garbage now");
    ASSERT_EQ(0, lib.Scan(music, &r, nullptr, limit));
    EXPECT_TRUE(HasEntry(r.failures, "good.mp3: "));
    EXPECT_EQ(0, lib.FindByPath(canon + "/good.mp3", &s));
    EXPECT_EQ(2, lib.SongCount());
}

TEST_F(ScanTest, DamagedForeignAndLockedDatabasesGiveClearErrors)
{
    Song("a.mp3", {"A", "X", "", "", 0, 0});
    MediaLib lib;
    // Missing library without create.
    EXPECT_EQ(-1, lib.Open(db, false));
    EXPECT_NE(std::string::npos, lib.LastError().find("tarnlib scan")) << lib.LastError();

    // Not a database at all.
    WriteText(db, std::string(8192, 'x'));
    EXPECT_EQ(-1, lib.Open(db, true));
    EXPECT_NE(std::string::npos, lib.LastError().find("damaged")) << lib.LastError();
    EXPECT_EQ(8192u, fs::file_size(db)) << "a damaged library is left as it was";

    // An SQLite database of something else.
    fs::remove(db);
    sqlite3 *other = nullptr;
    ASSERT_EQ(SQLITE_OK, sqlite3_open(db.c_str(), &other));
    ASSERT_EQ(SQLITE_OK, sqlite3_exec(other, "CREATE TABLE t(x)", nullptr, nullptr, nullptr));
    sqlite3_close(other);
    EXPECT_EQ(-1, lib.Open(db, true));
    EXPECT_NE(std::string::npos, lib.LastError().find("not a media library")) << lib.LastError();

    // A real library whose pages were overwritten.
    fs::remove(db);
    {
        MediaLib good;
        ASSERT_EQ(0, good.Open(db, true));
        ScanReport r;
        ASSERT_EQ(0, good.Scan(music, &r));
    }
    fs::remove(db + "-wal");
    fs::remove(db + "-shm");
    {
        std::fstream f(db, std::ios::in | std::ios::out | std::ios::binary);
        f.seekp(0);
        f << std::string(100, '\x01');
    }
    EXPECT_EQ(-1, lib.Open(db, false));
    EXPECT_NE(std::string::npos, lib.LastError().find("damaged")) << lib.LastError();

    // Locked: another writer holds the database beyond the busy timeout.
    fs::remove(db);
    ASSERT_EQ(0, lib.Open(db, true)) << lib.LastError();
    ASSERT_EQ(SQLITE_OK, sqlite3_open(db.c_str(), &other));
    ASSERT_EQ(SQLITE_OK, sqlite3_exec(other, "BEGIN IMMEDIATE; DELETE FROM songs;", nullptr, nullptr, nullptr));
    ScanReport r;
    EXPECT_EQ(-1, lib.Scan(music, &r));
    EXPECT_NE(std::string::npos, lib.LastError().find("another process")) << lib.LastError();
    sqlite3_exec(other, "ROLLBACK", nullptr, nullptr, nullptr);
    sqlite3_close(other);
    EXPECT_EQ(0, lib.SongCount()) << "the failed scan wrote nothing";
    ASSERT_EQ(0, lib.Scan(music, &r));
    EXPECT_EQ(1, lib.SongCount());
}

TEST_F(ScanTest, ReaderSeesWholeScansOnly)
{
    for (int i = 0; i < 30; i++)
        Song("s" + std::to_string(i) + ".mp3", {"S" + std::to_string(i), "X", "", "", 0, i});
    MediaLib writer, reader;
    ASSERT_EQ(0, writer.Open(db, true));
    ASSERT_EQ(0, reader.Open(db, false));
    ScanReport r;
    std::vector<int> seen;
    // While the files are read the new songs are not visible yet.
    ASSERT_EQ(0, writer.Scan(music, &r, [&](int, int) { seen.push_back(reader.SongCount()); }));
    ASSERT_EQ(30u, seen.size());
    for (int n : seen)
        EXPECT_EQ(0, n);
    EXPECT_EQ(30, reader.SongCount());
}

TEST(SmartRuleParse, AcceptsTheRuleFormsAndRejectsBadOnes)
{
    SmartRule r;
    std::string why;
    ASSERT_EQ(0, SmartRuleParse("genre is Jazz", &r, &why)) << why;
    EXPECT_EQ("genre", r.field);
    EXPECT_EQ("is", r.op);
    EXPECT_EQ("Jazz", r.value);
    ASSERT_EQ(0, SmartRuleParse("Year FROM 1990 to 1999", &r, &why)) << why;
    EXPECT_EQ("from", r.op);
    EXPECT_EQ("1990", r.value);
    EXPECT_EQ("1999", r.value2);
    ASSERT_EQ(0, SmartRuleParse("artist contains Miles Davis", &r, &why));
    EXPECT_EQ("Miles Davis", r.value);
    ASSERT_EQ(0, SmartRuleParse("genre is not Pop", &r, &why));
    EXPECT_EQ("isnot", r.op);
    EXPECT_EQ("genre is not Pop", SmartRuleText(r));
    ASSERT_EQ(0, SmartRuleParse("title starts with The", &r, &why));
    EXPECT_EQ("startswith", r.op);

    EXPECT_EQ(-1, SmartRuleParse("genre", &r, &why));
    EXPECT_EQ(-1, SmartRuleParse("mood is happy", &r, &why));
    EXPECT_NE(std::string::npos, why.find("unknown field"));
    EXPECT_EQ(-1, SmartRuleParse("genre like Jazz", &r, &why));
    EXPECT_EQ(-1, SmartRuleParse("year is nineteen", &r, &why));
    EXPECT_EQ(-1, SmartRuleParse("year from 1990", &r, &why));
    EXPECT_EQ(-1, SmartRuleParse("genre above 3", &r, &why));
    EXPECT_EQ(-1, SmartRuleParse("genre is", &r, &why));
}

}  // namespace
