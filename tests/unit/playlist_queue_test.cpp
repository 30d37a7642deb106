// The play queue: songs, current song, repeat modes, shuffle order.
#include <gtest/gtest.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <numeric>
#include <string>
#include <vector>

#include "player/playlist.h"
#include "player/tarn_rand.h"
#include "tests/harness/harness.h"

namespace {

TARN_MEDIA_INFO Song(int i)
{
    TARN_MEDIA_INFO info = tarntest::MakeMediaInfo("/music/song" + std::to_string(i) + ".mp3", "",
                                                   "Artist " + std::to_string(i), 180.5f);
    info.id = static_cast<uint32_t>(1000 + i);
    return info;
}

std::string PathOf(int i)
{
    return "/music/song" + std::to_string(i) + ".mp3";
}

// The shuffle the queue must perform, computed with the C library's rand().
void ReferenceShuffle(std::vector<int32_t> &order)
{
    for (size_t i = 1; i < order.size(); ++i) {
        size_t j = static_cast<size_t>(rand()) % (i + 1);
        std::swap(order[i], order[j]);
    }
}

std::vector<int32_t> Identity(size_t n)
{
    std::vector<int32_t> v(n);
    std::iota(v.begin(), v.end(), 0);
    return v;
}

class QueueTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        harness.reset(new tarntest::Harness());
        ASSERT_EQ("", harness->Error());
        // The queue's sequence and the C library's reference start together.
        TarnRandReset();
        srand(1);
    }
    void Fill(Playlist &p, int n)
    {
        for (int i = 0; i < n; ++i) {
            TARN_MEDIA_INFO s = Song(i);
            ASSERT_EQ(0, p.AddSong(&s));
        }
    }
    int Logged(const std::string &text) { return harness->CountLog(text); }
    std::unique_ptr<tarntest::Harness> harness;
};

TEST_F(QueueTest, EmptyQueueRefusesEverythingThatNeedsASong)
{
    Playlist p;
    EXPECT_EQ(1, p.GetMode());
    EXPECT_FALSE(p.IsShuffle());
    EXPECT_EQ(0u, p.Count());
    std::string uri = "unchanged";
    TARN_MEDIA_INFO out;
    EXPECT_EQ(-1, p.GetCurrentSong(&out));
    EXPECT_EQ(-1, p.GetCurrentUri(uri));
    EXPECT_EQ(-1, p.Next(uri, false));
    EXPECT_EQ(-1, p.Next(uri, true));
    EXPECT_EQ(-1, p.Previous(uri, false));
    EXPECT_EQ("unchanged", uri);
    Json::Value info;
    EXPECT_EQ(-1, p.GetCurrentInfoJson(info));
    EXPECT_EQ(-1, p.SetCurrent(0));
    EXPECT_EQ(-1, p.RemoveSong(0));
    TARN_MEDIA_INFO s = Song(0);
    EXPECT_EQ(-1, p.InsertSong(0, &s));
    EXPECT_EQ(0u, p.Count());
    EXPECT_EQ(-1, p.AddSong(nullptr));
}

TEST_F(QueueTest, EntriesArePrivateCopiesOfTheWholeRecord)
{
    Playlist p;
    TARN_MEDIA_INFO s = Song(7);
    // Bytes the queue never reads must survive the copy as well.
    memset(s.reserved4, 0x5a, sizeof(s.reserved4));
    ASSERT_EQ(0, p.AddSong(&s));
    TARN_MEDIA_INFO original = s;
    snprintf(s.path, sizeof(s.path), "/changed.mp3");
    TARN_MEDIA_INFO out;
    memset(&out, 0, sizeof(out));
    ASSERT_EQ(0, p.GetCurrentSong(&out));
    EXPECT_EQ(0, memcmp(&original, &out, sizeof(out)));
    std::string uri;
    ASSERT_EQ(0, p.GetCurrentUri(uri));
    EXPECT_EQ(PathOf(7), uri);
}

TEST_F(QueueTest, NormalModeStopsAtBothEnds)
{
    Playlist p;
    Fill(p, 3);
    std::string uri;
    EXPECT_EQ(-1, p.Previous(uri, false));
    EXPECT_EQ(0u, p.OrderIndex());
    ASSERT_EQ(0, p.Next(uri, false));
    EXPECT_EQ(PathOf(1), uri);
    ASSERT_EQ(0, p.Next(uri, true));
    EXPECT_EQ(PathOf(2), uri);
    EXPECT_EQ(2u, p.Current());
    uri = "unchanged";
    EXPECT_EQ(-1, p.Next(uri, true));
    EXPECT_EQ(-1, p.Next(uri, false));
    EXPECT_EQ("unchanged", uri);
    EXPECT_EQ(2u, p.OrderIndex());
    ASSERT_EQ(0, p.Previous(uri, false));
    EXPECT_EQ(PathOf(1), uri);
    EXPECT_EQ(1u, p.Current());
}

TEST_F(QueueTest, RepeatAllWrapsBothWays)
{
    Playlist p;
    Fill(p, 3);
    ASSERT_EQ(0, p.SetMode(3));
    std::string uri;
    ASSERT_EQ(0, p.Previous(uri, false));
    EXPECT_EQ(PathOf(2), uri);
    EXPECT_EQ(2u, p.OrderIndex());
    ASSERT_EQ(0, p.Next(uri, true));
    EXPECT_EQ(PathOf(0), uri);
    EXPECT_EQ(0u, p.OrderIndex());
    ASSERT_EQ(0, p.Next(uri, false));
    ASSERT_EQ(0, p.Next(uri, false));
    ASSERT_EQ(0, p.Next(uri, false));
    EXPECT_EQ(PathOf(0), uri);
}

TEST_F(QueueTest, RepeatOneRepeatsOnlyAtTheNaturalEnd)
{
    Playlist p;
    Fill(p, 3);
    ASSERT_EQ(0, p.SetMode(2));
    std::string uri;
    ASSERT_EQ(0, p.Next(uri, true));
    EXPECT_EQ(PathOf(0), uri);
    ASSERT_EQ(0, p.Next(uri, false));
    EXPECT_EQ(PathOf(1), uri);
    ASSERT_EQ(0, p.Previous(uri, true));
    EXPECT_EQ(PathOf(1), uri);
    ASSERT_EQ(0, p.Previous(uri, false));
    EXPECT_EQ(PathOf(0), uri);
    EXPECT_EQ(-1, p.Previous(uri, false));
    ASSERT_EQ(0, p.SetCurrent(2));
    EXPECT_EQ(-1, p.Next(uri, false));
    ASSERT_EQ(0, p.Next(uri, true));
    EXPECT_EQ(PathOf(2), uri);
}

TEST_F(QueueTest, ModeZeroIsRefusedAndOtherModesAreStored)
{
    Playlist p;
    Fill(p, 3);
    EXPECT_EQ(-1, p.SetMode(0));
    EXPECT_EQ(1, Logged("playlist:"));
    EXPECT_EQ(1, Logged(" Bad parameter"));
    EXPECT_EQ(1, p.GetMode());

    // A mode above the table is kept, but the queue cannot step with it.
    ASSERT_EQ(0, p.SetMode(7));
    EXPECT_EQ(7, p.GetMode());
    std::string uri;
    EXPECT_EQ(-1, p.Next(uri, false));
    EXPECT_EQ(-1, p.Next(uri, true));
    EXPECT_EQ(-1, p.Previous(uri, false));
    EXPECT_EQ(0u, p.OrderIndex());
    EXPECT_EQ(0, p.ToggleRepeatMode());
    EXPECT_EQ(7, p.GetMode());
    EXPECT_EQ(1, Logged("Failed to toggle repeat mode. Invalid playlist mode [7]"));
    Json::Value reply;
    ASSERT_EQ(0, p.ListJson(0, 1, reply));
    EXPECT_EQ("Unknown", reply["mode"].asString());

    ASSERT_EQ(0, p.SetMode(-4));
    EXPECT_EQ(-1, p.Next(uri, false));
    EXPECT_EQ(-1, p.Previous(uri, false));
    reply.clear();
    ASSERT_EQ(0, p.ListJson(0, 1, reply));
    EXPECT_EQ("Unknown", reply["mode"].asString());
}

TEST_F(QueueTest, RepeatModeCyclesAndShowsItsName)
{
    Playlist p;
    const char *names[] = {"", "Normal", "Repeat One", "Repeat All"};
    int expected[] = {2, 3, 1, 2};
    for (int want : expected) {
        ASSERT_EQ(0, p.ToggleRepeatMode());
        EXPECT_EQ(want, p.GetMode());
        Json::Value reply;
        ASSERT_EQ(0, p.ListJson(0, 0, reply));
        EXPECT_EQ(names[want], reply["mode"].asString());
    }
}

TEST_F(QueueTest, ShuffleAndRepeatOneNeverStandTogether)
{
    Playlist p;
    Fill(p, 5);
    ASSERT_EQ(0, p.SetMode(2));
    ASSERT_EQ(0, p.ToggleShuffle());
    EXPECT_TRUE(p.IsShuffle());
    EXPECT_EQ(1, p.GetMode());

    ASSERT_EQ(0, p.SetCurrent(3));
    ASSERT_EQ(0, p.SetMode(2));
    EXPECT_FALSE(p.IsShuffle());
    EXPECT_EQ(Identity(5), p.Order());
    EXPECT_EQ(3u, p.OrderIndex());

    // Cycling into "Repeat One" switches shuffle off too.
    ASSERT_EQ(0, p.SetMode(1));
    ASSERT_EQ(0, p.ToggleShuffle());
    ASSERT_EQ(0, p.ToggleRepeatMode());
    EXPECT_EQ(2, p.GetMode());
    EXPECT_FALSE(p.IsShuffle());
}

TEST_F(QueueTest, ShuffleFollowsTheCLibrarySequence)
{
    Playlist p;
    Fill(p, 6);
    std::vector<int32_t> expected = Identity(6);
    ASSERT_EQ(0, p.SetCurrent(4));
    ASSERT_EQ(0, p.ToggleShuffle());
    ReferenceShuffle(expected);
    EXPECT_EQ(expected, p.Order());
    EXPECT_EQ(0u, p.OrderIndex());
    EXPECT_EQ(4u, p.Current());
    EXPECT_NE(Identity(6), p.Order());

    // Adding while shuffled reshuffles the whole (already shuffled) order.
    TARN_MEDIA_INFO s = Song(6);
    const unsigned chosen = static_cast<unsigned>(expected[3]);
    ASSERT_EQ(0, p.SetCurrent(chosen));
    EXPECT_EQ(3u, p.OrderIndex());
    ASSERT_EQ(0, p.AddSong(&s));
    expected.push_back(6);
    ReferenceShuffle(expected);
    EXPECT_EQ(expected, p.Order());
    EXPECT_EQ(0u, p.OrderIndex());
    EXPECT_EQ(chosen, p.Current());

    // The walk follows the order; the first read takes the current song from it.
    std::string uri;
    ASSERT_EQ(0, p.GetCurrentUri(uri));
    EXPECT_EQ(PathOf(expected[0]), uri);
    EXPECT_EQ(static_cast<unsigned>(expected[0]), p.Current());
    ASSERT_EQ(0, p.Next(uri, false));
    EXPECT_EQ(PathOf(expected[1]), uri);

    // SetCurrent finds the song's position in the order.
    ASSERT_EQ(0, p.SetCurrent(static_cast<unsigned>(expected[5])));
    EXPECT_EQ(5u, p.OrderIndex());

    // Removing and inserting start from the plain order, then reshuffle.
    ASSERT_EQ(0, p.RemoveSong(0));
    expected = Identity(6);
    ReferenceShuffle(expected);
    EXPECT_EQ(expected, p.Order());
    ASSERT_EQ(0, p.InsertSong(1, &s));
    expected = Identity(7);
    ReferenceShuffle(expected);
    EXPECT_EQ(expected, p.Order());

    // Off again: plain order, position of the current song.
    unsigned cur = p.Current();
    ASSERT_EQ(0, p.ToggleShuffle());
    EXPECT_EQ(Identity(7), p.Order());
    EXPECT_EQ(cur, p.OrderIndex());

    // Appending without shuffle touches neither the order nor the position.
    ASSERT_EQ(0, p.AddSong(&s));
    EXPECT_EQ(Identity(8), p.Order());
    EXPECT_EQ(cur, p.OrderIndex());
}

TEST_F(QueueTest, ShuffleOfOneSongOrNoneIsTrivial)
{
    Playlist p;
    ASSERT_EQ(0, p.ToggleShuffle());
    EXPECT_TRUE(p.Order().empty());
    Fill(p, 1);
    EXPECT_EQ(Identity(1), p.Order());
    // One song consumed no random value: the next shuffle of two songs uses
    // the very first value of the sequence.
    Fill(p, 1);
    std::vector<int32_t> expected = Identity(2);
    ReferenceShuffle(expected);
    EXPECT_EQ(expected, p.Order());
}

TEST_F(QueueTest, RemovingAroundTheCurrentSong)
{
    Playlist p;
    Fill(p, 5);
    ASSERT_EQ(0, p.SetCurrent(2));
    // After the current song: nothing moves.
    ASSERT_EQ(0, p.RemoveSong(4));
    EXPECT_EQ(2u, p.Current());
    // Before it: the current song keeps playing under its new index.
    ASSERT_EQ(0, p.RemoveSong(0));
    EXPECT_EQ(1u, p.Current());
    EXPECT_EQ(1u, p.OrderIndex());
    std::string uri;
    ASSERT_EQ(0, p.GetCurrentUri(uri));
    EXPECT_EQ(PathOf(2), uri);
    // The current song itself: the following song takes its place.
    ASSERT_EQ(0, p.RemoveSong(1));
    EXPECT_EQ(1u, p.Current());
    ASSERT_EQ(0, p.GetCurrentUri(uri));
    EXPECT_EQ(PathOf(3), uri);
    EXPECT_EQ(2u, p.Count());
    // The last song while current: current is left past the end and the next
    // read falls back to the first song.
    ASSERT_EQ(0, p.RemoveSong(1));
    EXPECT_EQ(1u, p.Current());
    Json::Value info;
    EXPECT_EQ(-1, p.GetCurrentInfoJson(info));
    ASSERT_EQ(0, p.GetCurrentUri(uri));
    EXPECT_EQ(PathOf(1), uri);
    EXPECT_EQ(0u, p.Current());
    EXPECT_EQ(0u, p.OrderIndex());
    ASSERT_EQ(0, p.GetCurrentInfoJson(info));
    EXPECT_EQ(0, info["current"].asInt());
}

TEST_F(QueueTest, BadIndexesChangeNothing)
{
    Playlist p;
    Fill(p, 3);
    ASSERT_EQ(0, p.SetCurrent(1));
    TARN_MEDIA_INFO s = Song(9);
    harness->ClearLog();
    EXPECT_EQ(-1, p.RemoveSong(3));
    EXPECT_EQ(-1, p.RemoveSong(static_cast<unsigned>(-1)));
    EXPECT_EQ(-1, p.SetCurrent(3));
    EXPECT_EQ(-1, p.SetCurrent(static_cast<unsigned>(-2)));
    // Inserting at the end is AddSong's job.
    EXPECT_EQ(-1, p.InsertSong(3, &s));
    EXPECT_EQ(-1, p.InsertSong(0, nullptr));
    EXPECT_EQ(6, Logged("Bad parameters"));
    EXPECT_EQ(3u, p.Count());
    EXPECT_EQ(1u, p.Current());
    EXPECT_EQ(1u, p.OrderIndex());
    EXPECT_EQ(Identity(3), p.Order());
}

TEST_F(QueueTest, InsertingAroundTheCurrentSong)
{
    Playlist p;
    Fill(p, 3);
    ASSERT_EQ(0, p.SetCurrent(1));
    TARN_MEDIA_INFO a = Song(10);
    TARN_MEDIA_INFO b = Song(11);
    TARN_MEDIA_INFO c = Song(12);
    // Before the current song: it keeps playing under its new index.
    ASSERT_EQ(0, p.InsertSong(0, &a));
    EXPECT_EQ(2u, p.Current());
    EXPECT_EQ(2u, p.OrderIndex());
    std::string uri;
    ASSERT_EQ(0, p.GetCurrentUri(uri));
    EXPECT_EQ(PathOf(1), uri);
    // At the current index: the new song becomes current.
    ASSERT_EQ(0, p.InsertSong(2, &b));
    EXPECT_EQ(2u, p.Current());
    ASSERT_EQ(0, p.GetCurrentUri(uri));
    EXPECT_EQ(PathOf(11), uri);
    // After it: nothing moves.
    ASSERT_EQ(0, p.InsertSong(4, &c));
    EXPECT_EQ(2u, p.Current());
    std::vector<std::string> paths;
    for (unsigned i = 0; i < p.Count(); ++i)
        paths.push_back(p.Entry(i)->path);
    EXPECT_EQ((std::vector<std::string>{PathOf(10), PathOf(0), PathOf(11), PathOf(1), PathOf(12), PathOf(2)}),
              paths);
}

TEST_F(QueueTest, ClearKeepsModeAndShuffle)
{
    Playlist p;
    Fill(p, 4);
    ASSERT_EQ(0, p.SetMode(3));
    ASSERT_EQ(0, p.ToggleShuffle());
    ASSERT_EQ(0, p.SetCurrent(2));
    ASSERT_EQ(0, p.Clear());
    EXPECT_EQ(0u, p.Count());
    EXPECT_TRUE(p.Order().empty());
    EXPECT_EQ(0u, p.Current());
    EXPECT_EQ(0u, p.OrderIndex());
    EXPECT_EQ(3, p.GetMode());
    EXPECT_TRUE(p.IsShuffle());
    std::string uri;
    EXPECT_EQ(-1, p.Next(uri, true));
    Fill(p, 2);
    ASSERT_EQ(0, p.GetCurrentUri(uri));
}

TEST_F(QueueTest, CurrentInfoTitleFallsBackToTheFileName)
{
    Playlist p;
    TARN_MEDIA_INFO a = tarntest::MakeMediaInfo("/music/x/Track One.flac", "Real Title", "Band");
    TARN_MEDIA_INFO b = tarntest::MakeMediaInfo("/music/x/Track Two.flac", "", "Band");
    b.title[0] = '\0';
    TARN_MEDIA_INFO c = tarntest::MakeMediaInfo("noslash.mp3");
    c.title[0] = '\0';
    TARN_MEDIA_INFO d = tarntest::MakeMediaInfo("/music/dir/");
    d.title[0] = '\0';
    for (TARN_MEDIA_INFO *s : {&a, &b, &c, &d})
        ASSERT_EQ(0, p.AddSong(s));
    const char *titles[] = {"Real Title", "Track Two.flac", "noslash.mp3", "/music/dir/"};
    for (unsigned i = 0; i < 4; ++i) {
        ASSERT_EQ(0, p.SetCurrent(i));
        Json::Value info;
        ASSERT_EQ(0, p.GetCurrentInfoJson(info));
        EXPECT_EQ(titles[i], info["title"].asString());
        EXPECT_TRUE(info["current"].isInt());
        EXPECT_EQ(static_cast<int>(i), info["current"].asInt());
        EXPECT_EQ(std::string(p.Entry(i)->path), info["path"].asString());
        EXPECT_EQ(std::string(p.Entry(i)->artist), info["artist"].asString());
    }
}

TEST_F(QueueTest, UnterminatedTextFieldsStayInsideTheirFields)
{
    Playlist p;
    TARN_MEDIA_INFO s;
    memset(&s, 'A', sizeof(s));
    memset(s.title, 'T', sizeof(s.title));
    memset(s.artist, 'R', sizeof(s.artist));
    ASSERT_EQ(0, p.AddSong(&s));
    Json::Value info;
    ASSERT_EQ(0, p.GetCurrentInfoJson(info));
    EXPECT_EQ(std::string(sizeof(s.title), 'T'), info["title"].asString());
    EXPECT_EQ(std::string(sizeof(s.artist), 'R'), info["artist"].asString());
    EXPECT_EQ(sizeof(s.path), info["path"].asString().size());
    std::string uri;
    ASSERT_EQ(0, p.GetCurrentUri(uri));
    EXPECT_EQ(sizeof(s.path), uri.size());
}

TEST_F(QueueTest, TenThousandSongs)
{
    const int n = 10000;
    Playlist p;
    Fill(p, n);
    ASSERT_EQ(static_cast<unsigned>(n), p.Count());
    ASSERT_EQ(0, p.SetMode(3));
    ASSERT_EQ(0, p.ToggleShuffle());
    std::vector<int32_t> expected = Identity(n);
    ReferenceShuffle(expected);
    ASSERT_EQ(expected, p.Order());

    // A full round in "Repeat All" plays every song once and wraps.
    std::vector<int> seen(n, 0);
    std::string uri;
    ASSERT_EQ(0, p.GetCurrentUri(uri));
    ++seen[p.Current()];
    for (int i = 1; i < n; ++i) {
        ASSERT_EQ(0, p.Next(uri, true));
        ++seen[p.Current()];
    }
    EXPECT_EQ(std::vector<int>(n, 1), seen);
    ASSERT_EQ(0, p.Next(uri, true));
    EXPECT_EQ(0u, p.OrderIndex());
    EXPECT_EQ(PathOf(expected[0]), uri);

    Json::Value all;
    ASSERT_EQ(0, p.ListJson(0, 0, all));
    EXPECT_EQ(static_cast<Json::ArrayIndex>(n), all["uris"].size());
    EXPECT_EQ(n, all["total"].asInt());
    EXPECT_EQ(n - 1, all["uris"][n - 1]["sequence"].asInt());
    Json::Value tail;
    ASSERT_EQ(0, p.ListJson(n - 10, 20, tail));
    ASSERT_EQ(10u, tail["uris"].size());
    EXPECT_EQ(n - 10, tail["uris"][0]["sequence"].asInt());

    // Emptying from the front keeps everything consistent down to nothing.
    for (int i = 0; i < n; ++i)
        ASSERT_EQ(0, p.RemoveSong(0)) << i;
    EXPECT_EQ(0u, p.Count());
    EXPECT_TRUE(p.Order().empty());
    EXPECT_EQ(-1, p.GetCurrentUri(uri));
}

}  // namespace
