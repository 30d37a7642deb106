// The tarnlib command in a temporary root: scan summary, rescan, listings
// and the error for a damaged library.
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>

#include "tests/harness/harness.h"
#include "tests/unit/medialib_songs.h"

namespace fs = std::filesystem;

namespace {

TEST(Tarnlib, ScanSummaryRescanAndErrors)
{
    tarntest::Harness h;
    std::string music = h.Root() + "/music", cache = h.Root() + "/cache";
    ASSERT_TRUE(medialibtest::MakeSong(cache, music + "/jazz/a.mp3", {"Alpha", "Ann", "One", "Jazz", 1995, 1}));
    ASSERT_TRUE(medialibtest::MakeSong(cache, music + "/rock/b.flac", {"Beta", "Bob", "Two", "Rock", 2005, 2}));
    ASSERT_TRUE(medialibtest::MakeSong(cache, music + "/c.ogg", {"Gamma", "Cy", "Three", "Jazz", 2010, 3}));
    std::ofstream(music + "/broken.mp3") << "no audio";
    std::ofstream(music + "/best.m3u") << "#PLAYLIST:Best Of\nc.ogg\nmissing.mp3\njazz/a.mp3\n";
    auto tarnlib = [&](std::vector<std::string> args, std::string *out) {
        args.insert(args.begin(), tarntest::BinPath("tarnlib"));
        return h.Run(args, out);
    };
    std::string out;
    EXPECT_EQ(1, tarnlib({"songs"}, &out)) << "no library yet";
    EXPECT_NE(std::string::npos, out.find("run \"tarnlib scan DIR\"")) << out;
    ASSERT_EQ(0, tarnlib({"scan", music}, &out)) << out;
    EXPECT_NE(std::string::npos, out.find("4 audio files, 3 added, 0 updated, 0 unchanged, 0 removed, 1 failed;"
                                          " 1 saved playlists; 3 songs in the library")) << out;
    EXPECT_NE(std::string::npos, out.find("failed: " + fs::canonical(music).string() + "/broken.mp3: ")) << out;
    EXPECT_EQ(std::string::npos, out.find("\r")) << "no progress bar without a terminal";
    fs::remove(music + "/c.ogg");
    ASSERT_EQ(0, tarnlib({"scan", music}, &out)) << out;
    EXPECT_NE(std::string::npos, out.find("3 audio files, 0 added, 0 updated, 2 unchanged, 1 removed, 1 failed")) << out;
    ASSERT_EQ(0, tarnlib({"songs"}, &out));
    EXPECT_NE(std::string::npos, out.find("\tAnn\tOne\tAlpha\tJazz\t1995\t1\t0:00\t")) << out;
    EXPECT_EQ(std::string::npos, out.find("Gamma"));

    std::ofstream(h.Path("/usr/tarn/var/medialib.db"), std::ios::trunc) << std::string(4096, 'z');
    fs::remove(h.Path("/usr/tarn/var/medialib.db-wal"));
    fs::remove(h.Path("/usr/tarn/var/medialib.db-shm"));
    EXPECT_EQ(1, tarnlib({"songs"}, &out));
    EXPECT_NE(std::string::npos, out.find("is damaged; move it aside")) << out;
}

}  // namespace
