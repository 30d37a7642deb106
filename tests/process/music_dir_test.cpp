// The music folders of the configuration (music_dir): `tarnlib scan` without
// a folder scans each of them, and the daemon's random source draws from
// what was found in all of them.
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>

#include "daemon/tarn_types.h"
#include "tests/harness/harness.h"
#include "tests/unit/medialib_songs.h"

namespace {

size_t Count(const std::string &text, const std::string &needle)
{
    size_t n = 0;
    for (size_t at = text.find(needle); at != std::string::npos; at = text.find(needle, at + 1))
        ++n;
    return n;
}

TEST(MusicDir, ScanWithoutFolderTakesTheConfiguredOnesAndTheDaemonPlaysFromThem)
{
    tarntest::Harness h;
    std::string a = h.Root() + "/music a", b = h.Root() + "/music-b", cache = h.Root() + "/cache";
    ASSERT_TRUE(medialibtest::MakeSong(cache, a + "/one.mp3", {"Alpha", "Ann", "One", "Jazz", 1995, 1}));
    ASSERT_TRUE(medialibtest::MakeSong(cache, b + "/sub/two.flac", {"Beta", "Bob", "Two", "Rock", 2005, 2}));
    auto tarnlib = [&](std::vector<std::string> args, std::string *out) {
        args.insert(args.begin(), tarntest::BinPath("tarnlib"));
        return h.Run(args, out);
    };
    std::string out;
    EXPECT_EQ(2, tarnlib({"scan"}, &out)) << "nothing configured";
    EXPECT_NE(std::string::npos, out.find("no music folder: give one (tarnlib scan DIR) or set music_dir in " +
                                          h.Path(TARN_INFO_CONF))) << out;

    // Two folders (one with a blank in its name, blanks around the ':'), and
    // one that does not exist: the others are still scanned, the status says
    // something failed.
    ASSERT_EQ(0, h.WriteFile(TARN_INFO_CONF, "# music\nmusic_dir=\"" + a + " : " + b + ":" + h.Root() +
                                                 "/gone\"\n"));
    EXPECT_EQ(1, tarnlib({"scan"}, &out)) << out;
    EXPECT_EQ(2u, Count(out, "1 audio files, 1 added")) << out;
    EXPECT_NE(std::string::npos, out.find("cannot scan " + h.Root() + "/gone: not a readable folder")) << out;
    ASSERT_EQ(0, h.WriteFile(TARN_INFO_CONF, "music_dir=" + a + ":" + b + "\n"));
    EXPECT_EQ(0, tarnlib({"scan"}, &out)) << out;
    EXPECT_EQ(2u, Count(out, "1 audio files, 0 added, 0 updated, 1 unchanged")) << out;
    ASSERT_EQ(0, tarnlib({"songs"}, &out));
    EXPECT_NE(std::string::npos, out.find("\tAlpha\t")) << out;
    EXPECT_NE(std::string::npos, out.find("\tBeta\t")) << out;
    // Folders given on the command line still win.
    EXPECT_EQ(0, tarnlib({"scan", b}, &out)) << out;
    EXPECT_EQ(1u, Count(out, "Scanned ")) << out;

    ASSERT_EQ(0, h.Start()) << h.Error();
    std::string reply;
    ASSERT_EQ(0, h.Request(ACT_SOURCE_RANDOM, nullptr, &reply)) << h.Error();
    ASSERT_EQ(0, h.Request(ACT_QUEUE_LIST, "0 50", &reply)) << h.Error();
    EXPECT_NE(std::string::npos, reply.find("one.mp3")) << reply;
    EXPECT_NE(std::string::npos, reply.find("two.flac")) << reply;
    EXPECT_EQ(0, h.Stop());
}

}  // namespace
