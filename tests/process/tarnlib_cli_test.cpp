// The tarnlib command in a temporary root: scan summary, listings, smart
// playlists, custom slots and its errors.
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>

#include "platform/media_playlists.h"
#include "tests/harness/harness.h"
#include "tests/unit/medialib_songs.h"

namespace fs = std::filesystem;
using medialibtest::MakeSong;

namespace {

class TarnlibTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        ASSERT_EQ("", h.Error());
        music = h.Root() + "/music";
        cache = h.Root() + "/cache";
        ASSERT_TRUE(MakeSong(cache, music + "/jazz/a.mp3", {"Alpha", "Ann", "One", "Jazz", 1995, 1}));
        ASSERT_TRUE(MakeSong(cache, music + "/rock/b.flac", {"Beta", "Bob", "Two", "Rock", 2005, 2}));
        ASSERT_TRUE(MakeSong(cache, music + "/c.ogg", {"Gamma", "Cy", "Three", "Jazz", 2010, 3}));
        std::ofstream(music + "/broken.mp3") << "no audio";
        std::ofstream(music + "/best.m3u") << "#PLAYLIST:Best Of\nc.ogg\nmissing.mp3\njazz/a.mp3\n";
    }
    int Tarnlib(std::vector<std::string> args, std::string *out)
    {
        args.insert(args.begin(), tarntest::BinPath("tarnlib"));
        return h.Run(args, out);
    }
    tarntest::Harness h;
    std::string music, cache;
};

TEST_F(TarnlibTest, ScanAndListings)
{
    std::string out;
    ASSERT_EQ(0, Tarnlib({"scan", music}, &out)) << out;
    EXPECT_NE(std::string::npos, out.find("4 audio files, 3 added, 0 updated, 0 unchanged, 0 removed, 1 failed;"
                                          " 1 saved playlists; 3 songs in the library"))
        << out;
    EXPECT_NE(std::string::npos, out.find("failed: " + fs::canonical(music).string() + "/broken.mp3: ")) << out;
    EXPECT_EQ(std::string::npos, out.find("\r")) << "no progress bar without a terminal";
    EXPECT_TRUE(fs::exists(h.Path("/usr/tarn/var/medialib.db")));

    fs::remove(music + "/c.ogg");
    ASSERT_EQ(0, Tarnlib({"scan", music}, &out)) << out;
    EXPECT_NE(std::string::npos, out.find("3 audio files, 0 added, 0 updated, 2 unchanged, 1 removed, 1 failed"))
        << out;

    ASSERT_EQ(0, Tarnlib({"songs"}, &out));
    EXPECT_NE(std::string::npos, out.find("\tAnn\tOne\tAlpha\tJazz\t1995\t1\t0:00\t")) << out;
    EXPECT_NE(std::string::npos, out.find("\tBob\tTwo\tBeta\tRock\t2005\t2\t")) << out;
    EXPECT_EQ(std::string::npos, out.find("Gamma"));

    ASSERT_EQ(0, Tarnlib({"playlists"}, &out));
    std::string list = fs::canonical(music).string() + "/best.m3u";
    EXPECT_EQ("Best Of\t" + list + "\n", out);
    ASSERT_EQ(0, Tarnlib({"playlist", "show", list}, &out));
    EXPECT_NE(std::string::npos, out.find("# Best Of: 1 playable songs")) << out;
    EXPECT_NE(std::string::npos, out.find("Alpha")) << out;
    EXPECT_EQ(1, Tarnlib({"playlist", "show", music + "/none.m3u"}, &out));
    EXPECT_NE(std::string::npos, out.find("cannot read playlist")) << out;
}

TEST_F(TarnlibTest, SmartPlaylistCommands)
{
    std::string out;
    ASSERT_EQ(0, Tarnlib({"scan", music}, &out)) << out;
    ASSERT_EQ(0, Tarnlib({"smart", "create", "Old Jazz", "genre is jazz", "year from 1990 to 1999"}, &out)) << out;
    ASSERT_EQ(0, Tarnlib({"smart", "create", "B or C", "--any", "artist is Bob", "artist starts with C"}, &out));
    ASSERT_EQ(0, Tarnlib({"smart", "list"}, &out));
    EXPECT_EQ("Old Jazz\tall\tgenre is jazz\tyear from 1990 to 1999\nB or C\tany\tartist is Bob\tartist starts with C\n",
              out);
    ASSERT_EQ(0, Tarnlib({"smart", "show", "Old Jazz"}, &out));
    EXPECT_NE(std::string::npos, out.find("# Old Jazz: 1 songs")) << out;
    EXPECT_NE(std::string::npos, out.find("Alpha"));
    ASSERT_EQ(0, Tarnlib({"smart", "show", "B or C"}, &out));
    EXPECT_NE(std::string::npos, out.find("# B or C: 2 songs")) << out;

    // The daemon's view of the same playlists.
    int total = 0;
    std::vector<std::string> names = MediaServer::SmartPLSEnum(0, 0, total, nullptr);
    EXPECT_EQ((std::vector<std::string>{"Old Jazz", "B or C"}), names);

    EXPECT_EQ(2, Tarnlib({"smart", "create", "Bad", "colour is red"}, &out));
    EXPECT_NE(std::string::npos, out.find("bad rule \"colour is red\": unknown field")) << out;
    EXPECT_EQ(1, Tarnlib({"smart", "show", "Nope"}, &out));
    EXPECT_NE(std::string::npos, out.find("no smart playlist named \"Nope\"")) << out;
    ASSERT_EQ(0, Tarnlib({"smart", "delete", "Old Jazz"}, &out));
    EXPECT_EQ(1, Tarnlib({"smart", "delete", "Old Jazz"}, &out));
    ASSERT_EQ(0, Tarnlib({"smart", "list"}, &out));
    EXPECT_EQ(std::string::npos, out.find("Old Jazz"));
}

TEST_F(TarnlibTest, CustomSlotsAndErrors)
{
    std::string out;
    EXPECT_EQ(1, Tarnlib({"custom", "show", "5"}, &out));
    ASSERT_EQ(0, Tarnlib({"custom", "set", "5", "radio", "http://r.invalid/s", "My Station"}, &out)) << out;
    ASSERT_EQ(0, Tarnlib({"custom", "show", "5"}, &out));
    EXPECT_EQ("type=radio\nsecond=http://r.invalid/s\nthird=My Station\n", out);
    std::string type, second, third;
    ASSERT_EQ(0, TARNAudioCustomGet(5, type, second, third));
    EXPECT_EQ("My Station", third);
    EXPECT_EQ(2, Tarnlib({"custom", "set", "5", "video", "a", "b"}, &out));

    EXPECT_EQ(2, Tarnlib({"frobnicate"}, &out));
    EXPECT_NE(std::string::npos, out.find("usage: tarnlib")) << out;
    EXPECT_EQ(1, Tarnlib({"songs"}, &out)) << "no library yet";
    EXPECT_NE(std::string::npos, out.find("run \"tarnlib scan DIR\"")) << out;
    EXPECT_EQ(1, Tarnlib({"scan", music + "/nowhere"}, &out));
    EXPECT_NE(std::string::npos, out.find("not a readable folder")) << out;

    // --db chooses another library file.
    std::string other = h.Root() + "/other.db";
    ASSERT_EQ(0, Tarnlib({"--db", other, "scan", music}, &out)) << out;
    EXPECT_TRUE(fs::exists(other));
    EXPECT_FALSE(fs::exists(h.Path("/usr/tarn/var/medialib.db")));

    // A damaged library is named with what to do.
    std::ofstream(other, std::ios::trunc) << std::string(4096, 'z');
    fs::remove(other + "-wal");
    fs::remove(other + "-shm");
    EXPECT_EQ(1, Tarnlib({"--db", other, "songs"}, &out));
    EXPECT_NE(std::string::npos, out.find("is damaged; move it aside")) << out;
}

}  // namespace
