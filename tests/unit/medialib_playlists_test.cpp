// The media library's playlist functions as the daemon calls them: saved
// M3U playlists, random selections, smart playlists, the iPod list, custom
// slots and the song lookup by id, on a real library in a temporary root.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>
#include <fstream>
#include <set>
#include <sstream>

#include "platform/media_playlists.h"
#include "platform/medialib.h"
#include "platform/tarn_env.h"
#include "tests/harness/harness.h"
#include "tests/unit/medialib_songs.h"

namespace fs = std::filesystem;
using medialibtest::MakeSong;
using medialibtest::Tags;

namespace {

class PlaylistsTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        ASSERT_EQ("", h.Error());
        music = h.Root() + "/music";
        cache = "/tmp/medialib-playlists-cache." + std::to_string(getpid());
        fs::create_directories(music);
    }
    static void TearDownTestSuite()
    {
        std::error_code ec;
        fs::remove_all("/tmp/medialib-playlists-cache." + std::to_string(getpid()), ec);
    }
    void Song(const std::string &rel, const Tags &t) { ASSERT_TRUE(MakeSong(cache, music + "/" + rel, t)) << rel; }
    void Scan(const std::string &dir)
    {
        MediaLib lib;
        ASSERT_EQ(0, lib.Open(MediaLibDefaultPath(), true)) << lib.LastError();
        ScanReport r;
        ASSERT_EQ(0, lib.Scan(dir, &r)) << lib.LastError();
    }
    static void WriteText(const std::string &path, const std::string &text)
    {
        fs::create_directories(fs::path(path).parent_path());
        std::ofstream(path, std::ios::binary) << text;
    }
    static std::string ReadText(const std::string &path)
    {
        std::ifstream in(path, std::ios::binary);
        std::stringstream ss;
        ss << in.rdbuf();
        return ss.str();
    }
    static std::vector<std::string> Titles(const std::vector<TARN_MEDIA_INFO> &songs)
    {
        std::vector<std::string> t;
        for (const TARN_MEDIA_INFO &s : songs)
            t.push_back(s.title);
        return t;
    }
    tarntest::Harness h;
    std::string music, cache;
};

TEST_F(PlaylistsTest, SavedPlaylistsResolveRelativeAndSkipMissingSongs)
{
    Song("a/one.mp3", {"One", "Ann", "", "", 0, 1});
    Song("a/two.flac", {"Two", "Ann", "", "", 0, 2});
    Song("b/three.ogg", {"Three", "Bob", "", "", 0, 3});
    std::string outside = h.Root() + "/elsewhere/four.mp3";  // not in the library
    ASSERT_TRUE(MakeSong(cache, outside, {"Four", "Out", "", "", 0, 4}));
    std::string canon = fs::canonical(music).string();
    WriteText(music + "/lists/mix.m3u",
              "#EXTM3U\n#PLAYLIST:Zebra Mix\n"
              "#EXTINF:1,Bob - Three\n../b/three.ogg\n"
              "../a/gone.mp3\n"
              "\r\n" +
                  canon + "/a/one.mp3\r\n" +
                  "file://" + canon + "/a/two%2Eflac\n" + "http://radio.invalid/stream\n" + outside + "\n");
    WriteText(music + "/lists/alpha.m3u8", "\xEF\xBB\xBF../a/two.flac\n");
    WriteText(music + "/lists/dead.m3u", "#EXTM3U\nnothing-here.mp3\n");
    Scan(music);

    std::vector<TARN_PLAYLIST_INFO> all;
    ASSERT_EQ(0, TARNPlaylistListAll(all, 0, 0, 0));
    ASSERT_EQ(3u, all.size());
    EXPECT_EQ("alpha", all[0].title);
    EXPECT_EQ("dead", all[1].title);
    EXPECT_EQ("Zebra Mix", all[2].title);
    EXPECT_EQ(canon + "/lists/mix.m3u", all[2].path);
    std::vector<TARN_PLAYLIST_INFO> first;
    ASSERT_EQ(0, TARNPlaylistListAll(first, 0, 1, 0));
    ASSERT_EQ(1u, first.size());
    EXPECT_EQ(all[0].path, first[0].path);

    std::vector<TARN_MEDIA_INFO> songs;
    int count = -1;
    ASSERT_EQ(0, ParsePlayListByFieldGivenPath(all[2].path.c_str(), &count, 0, 0, "*", 1, songs));
    EXPECT_EQ(4, count);
    EXPECT_EQ((std::vector<std::string>{"Three", "One", "Two", "Four"}), Titles(songs));
    EXPECT_NE(0u, songs[0].id);
    EXPECT_STREQ((canon + "/b/three.ogg").c_str(), songs[0].path);
    EXPECT_EQ(0u, songs[3].id) << "a song outside the library has no id";
    EXPECT_EQ(0, songs[0].albumArtUrl[0]);

    // Paging.
    ASSERT_EQ(0, ParsePlayListByFieldGivenPath(all[2].path.c_str(), &count, 1, 2, "*", 1, songs));
    EXPECT_EQ((std::vector<std::string>{"One", "Two"}), Titles(songs));

    // No playable song, no file: both "no playlist".
    EXPECT_EQ(-1, ParsePlayListByFieldGivenPath(all[1].path.c_str(), &count, 0, 0, "*", 1, songs));
    EXPECT_EQ(0, count);
    EXPECT_TRUE(songs.empty());
    EXPECT_EQ(-1, ParsePlayListByFieldGivenPath((music + "/nope.m3u").c_str(), &count, 0, 0, "*", 1, songs));

    char title[255];
    ASSERT_EQ(0, TARNPlaylistTitleGetByPath(all[2].path.c_str(), title, sizeof(title)));
    EXPECT_STREQ("Zebra Mix", title);
    EXPECT_EQ(-1, TARNPlaylistTitleGetByPath((music + "/nope.m3u").c_str(), title, sizeof(title)));

    // A deleted playlist file leaves the library at the next scan.
    fs::remove(music + "/lists/alpha.m3u8");
    Scan(music);
    ASSERT_EQ(0, TARNPlaylistListAll(all, 0, 0, 0));
    ASSERT_EQ(2u, all.size());
    EXPECT_EQ("dead", all[0].title);
}

TEST_F(PlaylistsTest, RandomSelectionHasDistinctLibrarySongs)
{
    std::string path = TarnPath("/tmp/==DynaRandom100==.@remote_control");
    // No library yet.
    EXPECT_EQ(0, AudioFile::PlaylistRandomCreate(path.c_str(), 100));
    // An empty library.
    Scan(music);
    EXPECT_EQ(0, AudioFile::PlaylistRandomCreate(path.c_str(), 100));
    EXPECT_FALSE(fs::exists(path));

    // A small library: every song once.
    for (int i = 0; i < 4; i++)
        Song("small/s" + std::to_string(i) + ".mp3", {"Small " + std::to_string(i), "A", "", "", 0, i});
    Scan(music);
    ASSERT_NE(0, AudioFile::PlaylistRandomCreate(path.c_str(), 100));
    AudioFile::PlaylistFile *file = AudioFile::PlaylistFileLoad(path.c_str(), 0, 0);
    ASSERT_NE(nullptr, file);
    EXPECT_EQ(4u, file->Count());
    std::set<uint32_t> ids;
    for (const TARN_MEDIA_INFO &s : file->songs)
        ids.insert(s.id);
    EXPECT_EQ(4u, ids.size());
    EXPECT_EQ(0u, ids.count(0));
    delete file;

    // A larger library: 100 distinct songs, a new selection every time.
    for (int i = 0; i < 146; i++)
        Song("big/b" + std::to_string(i) + ".ogg", {"Big " + std::to_string(i), "B", "", "", 0, i});
    Scan(music);
    std::vector<uint32_t> firstOrder;
    std::set<uint32_t> firstIds;
    for (int round = 0; round < 2; round++) {
        ASSERT_NE(0, AudioFile::PlaylistRandomCreate(path.c_str(), 100));
        file = AudioFile::PlaylistFileLoad(path.c_str(), 0, 0);
        ASSERT_NE(nullptr, file);
        ASSERT_EQ(100u, file->Count());
        ids.clear();
        std::vector<uint32_t> order;
        for (const TARN_MEDIA_INFO &s : file->songs) {
            ids.insert(s.id);
            order.push_back(s.id);
            TARN_MEDIA_INFO byId;
            ASSERT_EQ(1, MediaLibFindById(s.id, &byId));
            EXPECT_STREQ(s.path, byId.path);
        }
        EXPECT_EQ(100u, ids.size());
        if (round == 0) {
            firstOrder = order;
            firstIds = ids;
        } else {
            EXPECT_NE(firstOrder, order);
            EXPECT_NE(firstIds, ids) << "a new selection, not only a new order";
        }
        delete file;
    }
    // The file is replaced whole: no temporary files are left beside it.
    for (const auto &e : fs::directory_iterator(fs::path(path).parent_path()))
        EXPECT_EQ(std::string::npos, e.path().string().find(".tmp.")) << e.path();

    EXPECT_EQ(0, AudioFile::PlaylistRandomCreate(path.c_str(), 0));
    EXPECT_EQ(0, AudioFile::PlaylistRandomCreate((path + "/below-a-file").c_str(), 100));
    EXPECT_EQ(nullptr, AudioFile::PlaylistFileLoad((h.Root() + "/tmp/none.m3u").c_str(), 0, 0));
}

TEST_F(PlaylistsTest, SmartPlaylistsFollowTheirRules)
{
    Song("1.mp3", {"Take Five", "Dave", "Time Out", "Jazz", 1959, 1});
    Song("2.mp3", {"So What", "Miles", "Kind of Blue", "Jazz", 1959, 1});
    Song("3.flac", {"Nineties Jazz", "Joshua", "Moodswing", "jazz", 1994, 2});
    Song("4.ogg", {"Grunge", "Band", "Nevermind", "Rock", 1991, 1});
    Song("5.ogg", {"100% Pure", "Pct", "", "Pop", 2003, 1});
    Song("6.mp3", {"Late Jazz", "Miles", "Later", "Jazz", 1999, 3});
    Scan(music);

    MediaLib lib;
    ASSERT_EQ(0, lib.Open(MediaLibDefaultPath(), false));
    auto save = [&](const std::string &name, std::vector<std::string> rules, bool any = false) {
        SmartPlaylist p;
        p.name = name;
        p.matchAny = any;
        for (const std::string &t : rules) {
            SmartRule r;
            std::string why;
            EXPECT_EQ(0, SmartRuleParse(t, &r, &why)) << t << ": " << why;
            p.rules.push_back(r);
        }
        return lib.SaveSmart(p);
    };
    ASSERT_EQ(0, save("Jazz 90s", {"genre is JAZZ", "year from 1990 to 1999"}));
    ASSERT_EQ(0, save("Miles", {"artist contains ile"}));
    ASSERT_EQ(0, save("Percent", {"title contains %"}));
    ASSERT_EQ(0, save("Injection", {"artist is x' OR '1'='1"}));
    ASSERT_EQ(0, save("Either", {"genre is Rock", "genre is Pop"}, true));
    ASSERT_EQ(0, save("Not jazz", {"genre is not jazz", "year above 2000"}));
    // Replacing a playlist keeps its place.
    ASSERT_EQ(0, save("Miles", {"artist is Miles", "title starts with Late"}));
    EXPECT_EQ(-1, lib.SaveSmart(SmartPlaylist{0, "Empty", false, {}}));

    int total = -1;
    std::vector<std::string> names = MediaServer::SmartPLSEnum(0, 0, total, nullptr);
    EXPECT_EQ(6, total);
    EXPECT_EQ((std::vector<std::string>{"Jazz 90s", "Miles", "Percent", "Injection", "Either", "Not jazz"}), names);
    EXPECT_EQ((std::vector<std::string>{"Percent", "Injection"}), MediaServer::SmartPLSEnum(2, 2, total, nullptr));

    auto songsOf = [&](int index) {
        std::list<TARN_MEDIA_INFO> songs;
        int n = -1;
        EXPECT_EQ(0, MediaServer::SmartPLSListSongs(index, 0, 0, n, songs));
        std::vector<std::string> titles;
        for (const TARN_MEDIA_INFO &s : songs) {
            titles.push_back(s.title);
            EXPECT_NE(0u, s.id);
        }
        EXPECT_EQ((int)titles.size(), n);
        return titles;
    };
    EXPECT_EQ((std::vector<std::string>{"Nineties Jazz", "Late Jazz"}), songsOf(0));
    EXPECT_EQ((std::vector<std::string>{"Late Jazz"}), songsOf(1));
    EXPECT_EQ((std::vector<std::string>{"100% Pure"}), songsOf(2));
    EXPECT_TRUE(songsOf(3).empty());
    EXPECT_EQ((std::vector<std::string>{"Grunge", "100% Pure"}), songsOf(4));
    EXPECT_EQ((std::vector<std::string>{"100% Pure"}), songsOf(5));

    std::list<TARN_MEDIA_INFO> songs;
    EXPECT_EQ(-1, MediaServer::SmartPLSListSongs(6, 0, 0, total, songs));
    EXPECT_EQ(-1, MediaServer::SmartPLSListSongs(-1, 0, 0, total, songs));
    EXPECT_EQ(0, MediaServer::SmartPLSListSongs(0, 1, 0, total, songs));
    EXPECT_EQ(2, total);
    ASSERT_EQ(1u, songs.size());
    EXPECT_STREQ("Late Jazz", songs.front().title);

    EXPECT_EQ(1, lib.DeleteSmart("Percent"));
    EXPECT_EQ(0, lib.DeleteSmart("Percent"));
    names = MediaServer::SmartPLSEnum(0, 0, total, nullptr);
    EXPECT_EQ(5, total);
    EXPECT_EQ("Injection", names[2]);
    EXPECT_EQ(6, lib.SongCount());
}

TEST_F(PlaylistsTest, IPodTrackList)
{
    std::string list = TarnPath("/usr/tarn/etc/audio/ipod/tracks.m3u");
    std::vector<TARN_MEDIA_INFO> songs;
    EXPECT_EQ(-1, TARNIPodListSongsAll(list.c_str(), songs, 0, 100));

    std::string ipod = h.Root() + "/media/ipod";
    ASSERT_TRUE(MakeSong(cache, ipod + "/t1.mp3", {"", "", "", "", 0, 0}));
    ASSERT_TRUE(MakeSong(cache, ipod + "/t2.mp3", {"Tagged", "", "", "", 0, 0}));
    WriteText(list, "#EXTM3U\n#EXTINF:10,Track From List\n" + ipod + "/t1.mp3\n" + ipod + "/lost.mp3\n" +
                        ipod + "/t2.mp3\n");
    ASSERT_EQ(2, TARNIPodListSongsAll(list.c_str(), songs, 0, 100));
    EXPECT_EQ((std::vector<std::string>{"Track From List", "Tagged"}), Titles(songs));
    ASSERT_EQ(1, TARNIPodListSongsAll(list.c_str(), songs, 0, 1));
    WriteText(list, "#EXTM3U\n");
    EXPECT_EQ(0, TARNIPodListSongsAll(list.c_str(), songs, 0, 100));
}

TEST_F(PlaylistsTest, CustomSlotsRoundTripAndReplaceWhole)
{
    std::string file = TarnPath("/usr/tarn/etc/audio/custom_slots.json");
    std::string type, second, third;
    EXPECT_EQ(-1, TARNAudioCustomGet(1, type, second, third));

    ASSERT_EQ(0, TARNAudioCustomSet(1, "playlist", "/music/a \"b\".m3u", "Title \xC3\xA9"));
    ASSERT_EQ(0, TARNAudioCustomSet(2, "radio", "http://x.invalid/s", "Station"));
    ASSERT_EQ(0, TARNAudioCustomGet(1, type, second, third));
    EXPECT_EQ("playlist", type);
    EXPECT_EQ("/music/a \"b\".m3u", second);
    EXPECT_EQ("Title \xC3\xA9", third);
    ASSERT_EQ(0, TARNAudioCustomSet(1, "smart", "Jazz", ""));
    ASSERT_EQ(0, TARNAudioCustomGet(1, type, second, third));
    EXPECT_EQ("smart", type);
    EXPECT_EQ("", third);
    ASSERT_EQ(0, TARNAudioCustomGet(2, type, second, third));
    EXPECT_EQ("radio", type);
    EXPECT_EQ(-1, TARNAudioCustomGet(3, type, second, third));
    EXPECT_EQ(-1, TARNAudioCustomGet(-1, type, second, third));

    // A store that cannot write its temporary file leaves the old file whole.
    std::string before = ReadText(file);
    std::string tmp = file + ".tmp." + std::to_string(getpid());
    fs::create_directory(tmp);
    EXPECT_EQ(-1, TARNAudioCustomSet(2, "radio", "http://y.invalid", "Other"));
    fs::remove(tmp);
    EXPECT_EQ(before, ReadText(file));
    ASSERT_EQ(0, TARNAudioCustomGet(2, type, second, third));
    EXPECT_EQ("http://x.invalid/s", second);

    // A damaged file: nothing to read, and the next store starts afresh.
    WriteText(file, "{\"slots\": {\"1\": ");
    EXPECT_EQ(-1, TARNAudioCustomGet(1, type, second, third));
    ASSERT_EQ(0, TARNAudioCustomSet(4, "radio", "u", "t"));
    ASSERT_EQ(0, TARNAudioCustomGet(4, type, second, third));
    EXPECT_EQ(-1, TARNAudioCustomGet(1, type, second, third));
    EXPECT_TRUE(fs::exists(file + ".damaged"));
}

TEST_F(PlaylistsTest, SongLookupById)
{
    TARN_MEDIA_INFO info;
    EXPECT_EQ(-1, MediaLibFindById(1, &info)) << "no library";
    Song("x.mp3", {"X", "Y", "Z", "G", 2020, 5});
    Scan(music);
    MediaLib lib;
    ASSERT_EQ(0, lib.Open(MediaLibDefaultPath(), false));
    std::vector<MediaSong> all;
    ASSERT_EQ(0, lib.ListSongs(&all));
    ASSERT_EQ(1u, all.size());
    ASSERT_EQ(1, MediaLibFindById(all[0].id, &info));
    EXPECT_STREQ("X", info.title);
    EXPECT_EQ(5, info.track);
    char path[4096];
    ASSERT_EQ(1, MediaLibPathById(all[0].id, path, sizeof(path)));
    EXPECT_EQ(all[0].path, path);
    EXPECT_EQ(0, MediaLibFindById(all[0].id + 1, &info));
    EXPECT_EQ(-1, MediaLibFindById(all[0].id, nullptr));
}

}  // namespace
