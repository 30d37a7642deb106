// The media library on real tagged files in a temporary root: scans and
// rescans, damaged files, random selections and smart playlists.
#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <set>

#include "platform/media_playlists.h"
#include "platform/medialib.h"
#include "platform/tarn_env.h"
#include "tests/harness/harness.h"
#include "tests/unit/medialib_songs.h"

namespace fs = std::filesystem;

namespace {

class LibraryTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        ASSERT_EQ("", h.Error());
        music = h.Root() + "/music";
        fs::create_directories(music);
    }
    static void TearDownTestSuite() { fs::remove_all(Cache()); }
    static std::string Cache() { return "/tmp/medialib-test-cache." + std::to_string(getpid()); }
    void Song(const std::string &rel, const medialibtest::Tags &t)
    {
        ASSERT_TRUE(medialibtest::MakeSong(Cache(), music + "/" + rel, t)) << rel;
    }
    ScanReport Scan(MediaLib &lib)
    {
        ScanReport r;
        EXPECT_EQ(0, lib.Scan(music, &r)) << lib.LastError();
        return r;
    }
    static void WriteText(const std::string &path, const std::string &text)
    {
        fs::create_directories(fs::path(path).parent_path());
        std::ofstream(path, std::ios::binary) << text;
    }
    static std::string Titles(const std::vector<TARN_MEDIA_INFO> &songs)
    {
        std::string t;
        for (const TARN_MEDIA_INFO &s : songs)
            t += std::string(t.empty() ? "" : ",") + s.title;
        return t;
    }
    tarntest::Harness h;
    std::string music;
    MediaLib lib;
};

TEST_F(LibraryTest, IncrementalRescanAndDamagedFilesAreSkipped)
{
    Song("a.mp3", {"A", "X", "Alb", "Pop", 2000, 1});
    Song("b.flac", {"B", "X", "", "Pop", 2000, 2});
    Song("c.ogg", {"Calm \xC3\xA9t\xC3\xA9", "X", "", "Pop", 2000, 3});
    WriteText(music + "/text.mp3", "this is not audio at all\n");
    Song("cut.flac", {"Cut", "A", "", "", 0, 0});
    fs::resize_file(music + "/cut.flac", 20);
    ASSERT_EQ(0, lib.Open(MediaLibDefaultPath(), true)) << lib.LastError();
    ScanReport r = Scan(lib);
    EXPECT_EQ(5, r.seen);
    EXPECT_EQ(3, r.added);
    EXPECT_EQ(2, r.failed);
    std::string failures = testing::PrintToString(r.failures);
    EXPECT_NE(std::string::npos, failures.find("text.mp3: ")) << failures;
    EXPECT_NE(std::string::npos, failures.find("cut.flac: ")) << failures;
    std::string canon = fs::canonical(music).string();
    MediaSong s, after;
    ASSERT_EQ(1, lib.FindByPath(canon + "/a.mp3", &s));
    EXPECT_EQ("Alb", s.album);
    EXPECT_NEAR(0.3, s.duration, 0.1);
    ASSERT_EQ(1, lib.FindByPath(canon + "/c.ogg", &s));
    EXPECT_EQ("Calm \xC3\xA9t\xC3\xA9", s.title);
    ASSERT_EQ(1, lib.FindByPath(canon + "/b.flac", &s));

    // Nothing changed: nothing is read again.
    int reads = 0;
    ASSERT_EQ(0, lib.Scan(music, &r, [&](int, int) { reads++; }));
    EXPECT_EQ(2, reads) << "only the failed files are tried again";
    EXPECT_EQ(3, r.unchanged);
    // New tags on b, c deleted, d added, a turned bad.
    Song("b.flac", {"B2", "Y", "", "Rock", 2001, 2});
    fs::last_write_time(music + "/b.flac", fs::file_time_type::clock::now() + std::chrono::seconds(5));
    fs::remove(music + "/c.ogg");
    Song("sub/d.mp3", {"D", "X", "", "Pop", 2000, 4});
    WriteText(music + "/a.mp3", "garbage now");
    r = Scan(lib);
    EXPECT_EQ(1, r.added);
    EXPECT_EQ(1, r.updated);
    EXPECT_EQ(1, r.removed);
    EXPECT_EQ(3, r.failed);
    EXPECT_EQ(2, lib.SongCount());
    ASSERT_EQ(1, lib.FindByPath(canon + "/b.flac", &after));
    EXPECT_EQ("B2", after.title);
    EXPECT_EQ(s.id, after.id) << "an updated song keeps its id";
    EXPECT_EQ(0, lib.FindByPath(canon + "/a.mp3", &after));
}

TEST_F(LibraryTest, RandomSelectionOfOneHundredDistinctSongs)
{
    for (int i = 0; i < 146; i++)
        Song("b" + std::to_string(i) + ".ogg", {"Big " + std::to_string(i), "B", "", "", 0, i});
    ASSERT_EQ(0, lib.Open(MediaLibDefaultPath(), true));
    Scan(lib);
    std::string path = TarnPath("/tmp/==DynaRandom100==.@remote_control");
    std::set<uint32_t> first;
    for (int round = 0; round < 2; round++) {
        ASSERT_NE(0, AudioFile::PlaylistRandomCreate(path.c_str(), 100));
        std::unique_ptr<AudioFile::PlaylistFile> file(AudioFile::PlaylistFileLoad(path.c_str(), 0, 0));
        ASSERT_NE(nullptr, file);
        std::set<uint32_t> ids;
        for (const TARN_MEDIA_INFO &s : file->songs) {
            TARN_MEDIA_INFO byId;
            ASSERT_EQ(1, MediaLibFindById(s.id, &byId));
            EXPECT_STREQ(s.path, byId.path);
            ids.insert(s.id);
        }
        EXPECT_EQ(100u, ids.size());
        EXPECT_TRUE(round == 0 || first != ids) << "a new selection every time";
        first = ids;
    }
}

TEST_F(LibraryTest, SmartPlaylistsFollowTheirRules)
{
    Song("1.mp3", {"Take Five", "Dave", "", "Jazz", 1959, 1});
    Song("3.flac", {"Nineties Jazz", "Joshua", "", "jazz", 1994, 2});
    Song("4.ogg", {"Grunge", "Band", "", "Rock", 1991, 1});
    Song("5.ogg", {"100% Pure", "Pct", "", "Pop", 2003, 1});
    Song("6.mp3", {"Late Jazz", "Miles", "", "Jazz", 1999, 3});
    ASSERT_EQ(0, lib.Open(MediaLibDefaultPath(), true));
    Scan(lib);
    struct {
        const char *name;
        std::vector<std::string> rules;
        bool any;
        const char *titles;
    } cases[] = {
        {"Jazz 90s", {"genre is JAZZ", "year from 1990 to 1999"}, false, "Nineties Jazz,Late Jazz"},
        {"Miles", {"artist contains ile", "title starts with Late"}, false, "Late Jazz"},
        {"Percent", {"title contains %"}, false, "100% Pure"},
        {"Injection", {"artist is x' OR '1'='1"}, false, ""},
        {"Either", {"genre is Rock", "genre is Pop"}, true, "Grunge,100% Pure"},
        {"Not jazz", {"genre is not jazz", "year above 2000"}, false, "100% Pure"},
    };
    for (const auto &c : cases) {
        SmartPlaylist p{0, c.name, c.any, {}};
        for (const std::string &t : c.rules) {
            SmartRule r;
            std::string why;
            ASSERT_EQ(0, SmartRuleParse(t, &r, &why)) << t << ": " << why;
            p.rules.push_back(r);
        }
        ASSERT_EQ(0, lib.SaveSmart(p));
    }
    int total = -1;
    EXPECT_EQ((std::vector<std::string>{"Percent", "Injection"}), MediaServer::SmartPLSEnum(2, 2, total, nullptr));
    EXPECT_EQ(6, total);
    for (int i = 0; i < 6; ++i) {
        std::list<TARN_MEDIA_INFO> songs;
        ASSERT_EQ(0, MediaServer::SmartPLSListSongs(i, 0, 0, total, songs));
        EXPECT_EQ(cases[i].titles, Titles({songs.begin(), songs.end()})) << cases[i].name;
    }
    EXPECT_EQ(5, lib.SongCount()) << "the injection text changed nothing";
    SmartRule r;
    std::string why;
    for (const char *bad : {"mood is happy", "genre like Jazz", "year is nineteen", "year from 1990", "genre is"})
        EXPECT_EQ(-1, SmartRuleParse(bad, &r, &why)) << bad;
}

}  // namespace
