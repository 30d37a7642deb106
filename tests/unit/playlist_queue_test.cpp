// The play queue: songs, current song, repeat modes, shuffle order, list pages.
#include <gtest/gtest.h>

#include <climits>
#include <cstdlib>
#include <cstring>
#include <numeric>
#include <string>
#include <vector>

#include "player/playlist_actions.h"
#include "player/tarn_rand.h"
#include "tests/harness/harness.h"

namespace {

std::string PathOf(int i)
{
    return "/music/song" + std::to_string(i) + ".mp3";
}

TARN_MEDIA_INFO Song(int i)
{
    return tarntest::MakeMediaInfo(PathOf(i), "", "Artist", 180.5f);
}

// The shuffle the queue must perform, computed with the C library's rand().
void ReferenceShuffle(std::vector<int32_t> &order)
{
    for (size_t i = 1; i < order.size(); ++i)
        std::swap(order[i], order[static_cast<size_t>(rand()) % (i + 1)]);
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
        ASSERT_EQ("", h.Error());
        TarnRandReset();  // the queue's sequence and the reference start together
        srand(1);
    }
    void Fill(int n)
    {
        for (int i = 0; i < n; ++i) {
            TARN_MEDIA_INFO s = Song(i);
            ASSERT_EQ(0, p.AddSong(&s));
        }
    }
    // Steps with Next (+1) or Previous (-1), natural end or not; the path
    // reached, or "-" when refused.
    std::string Step(int dir, bool natural)
    {
        std::string uri;
        int rc = dir > 0 ? p.Next(uri, natural) : p.Previous(uri, natural);
        return rc == 0 ? uri : "-";
    }
    tarntest::Harness h;
    Playlist p;
};

TEST_F(QueueTest, RepeatModesStepAsTheyShould)
{
    Fill(3);
    struct Case {
        int mode, from, dir;
        bool natural;
        std::string to;  // "-": refused
    } cases[] = {
        {1, 0, -1, false, "-"}, {1, 0, 1, false, PathOf(1)}, {1, 1, 1, true, PathOf(2)},
        {1, 2, 1, true, "-"},   {1, 2, 1, false, "-"},       {1, 2, -1, false, PathOf(1)},
        {3, 0, -1, false, PathOf(2)}, {3, 2, 1, true, PathOf(0)}, {3, 2, 1, false, PathOf(0)},
        // Repeat One repeats only at the natural end.
        {2, 0, 1, true, PathOf(0)}, {2, 0, 1, false, PathOf(1)}, {2, 1, -1, true, PathOf(1)},
        {2, 1, -1, false, PathOf(0)}, {2, 0, -1, false, "-"}, {2, 2, 1, false, "-"},
        // A mode above the table is stored, but the queue cannot step with it.
        {7, 0, 1, false, "-"}, {7, 0, 1, true, "-"}, {-4, 0, -1, false, "-"},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(testing::Message() << c.mode << " " << c.from << " " << c.dir << " " << c.natural);
        ASSERT_EQ(0, p.SetMode(c.mode));
        ASSERT_EQ(0, p.SetCurrent(c.from));
        EXPECT_EQ(c.to, Step(c.dir, c.natural));
        if (c.to == "-") {
            EXPECT_EQ(static_cast<unsigned>(c.from), p.OrderIndex());
        }
    }
    EXPECT_EQ(-1, p.SetMode(0));
    EXPECT_EQ(1, h.CountLog(" Bad parameter"));
    EXPECT_EQ(-4, p.GetMode());
    Json::Value reply;
    ASSERT_EQ(0, PlaylistListJson(p, 0, 1, reply));
    EXPECT_EQ("Unknown", reply["mode"].asString());
    // The cycle Normal -> Repeat One -> Repeat All -> Normal, with its names.
    ASSERT_EQ(0, p.SetMode(1));
    const char *names[] = {"", "Normal", "Repeat One", "Repeat All"};
    for (int want : {2, 3, 1}) {
        ASSERT_EQ(0, p.ToggleRepeatMode());
        ASSERT_EQ(0, PlaylistListJson(p, 0, 0, reply));
        EXPECT_EQ(names[want], reply["mode"].asString());
    }
}

TEST_F(QueueTest, ShuffleFollowsTheCLibrarySequence)
{
    Fill(6);
    std::vector<int32_t> expected = Identity(6);
    ASSERT_EQ(0, p.SetCurrent(4));
    ASSERT_EQ(0, p.ToggleShuffle());
    ReferenceShuffle(expected);
    EXPECT_EQ(expected, p.Order());
    EXPECT_EQ(4u, p.Current());

    // Adding while shuffled reshuffles the whole (already shuffled) order.
    TARN_MEDIA_INFO s = Song(6);
    const unsigned chosen = static_cast<unsigned>(expected[3]);
    ASSERT_EQ(0, p.SetCurrent(chosen));
    EXPECT_EQ(3u, p.OrderIndex());
    ASSERT_EQ(0, p.AddSong(&s));
    expected.push_back(6);
    ReferenceShuffle(expected);
    EXPECT_EQ(expected, p.Order());
    EXPECT_EQ(chosen, p.Current());
    // The walk follows the order; the first read takes the current song from it.
    std::string uri;
    ASSERT_EQ(0, p.GetCurrentUri(uri));
    EXPECT_EQ(PathOf(expected[0]), uri);
    EXPECT_EQ(PathOf(expected[1]), Step(1, false));
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

    // Repeat One switches shuffle off: plain order, position of the current song.
    unsigned cur = p.Current();
    ASSERT_EQ(0, p.SetMode(2));
    EXPECT_EQ(cur, p.OrderIndex());
    EXPECT_FALSE(p.IsShuffle());
    EXPECT_EQ(Identity(7), p.Order());
    ASSERT_EQ(0, p.ToggleShuffle());
    EXPECT_EQ(1, p.GetMode());
    ASSERT_EQ(0, p.ToggleRepeatMode());
    EXPECT_FALSE(p.IsShuffle());
}

TEST_F(QueueTest, RemovingAndInsertingAroundTheCurrentSong)
{
    Fill(5);
    ASSERT_EQ(0, p.SetCurrent(2));
    std::string uri;
    ASSERT_EQ(0, p.RemoveSong(4));  // after it: nothing moves
    ASSERT_EQ(0, p.RemoveSong(0));  // before it: it keeps playing under its new index
    EXPECT_EQ(1u, p.Current());
    EXPECT_EQ(1u, p.OrderIndex());
    ASSERT_EQ(0, p.RemoveSong(1));  // itself: the following song takes its place
    ASSERT_EQ(0, p.GetCurrentUri(uri));
    EXPECT_EQ(PathOf(3), uri);
    // The last song while current: the next read falls back to the first.
    ASSERT_EQ(0, p.RemoveSong(1));
    Json::Value info;
    EXPECT_EQ(-1, PlaylistCurrentInfoJson(p, info));
    ASSERT_EQ(0, p.GetCurrentUri(uri));
    EXPECT_EQ(PathOf(1), uri);
    EXPECT_EQ(0u, p.Current());

    TARN_MEDIA_INFO a = Song(10), b = Song(11), c = Song(12), d = Song(13);
    ASSERT_EQ(0, p.AddSong(&d));  // [1, 13], current 1
    ASSERT_EQ(0, p.SetCurrent(1));
    ASSERT_EQ(0, p.InsertSong(0, &a));  // before: current moves along
    EXPECT_EQ(2u, p.Current());
    EXPECT_EQ(2u, p.OrderIndex());
    ASSERT_EQ(0, p.InsertSong(2, &b));  // at it: the new song becomes current
    ASSERT_EQ(0, p.GetCurrentUri(uri));
    EXPECT_EQ(PathOf(11), uri);
    ASSERT_EQ(0, p.InsertSong(3, &c));  // after: nothing moves
    EXPECT_EQ(2u, p.Current());
    std::vector<std::string> paths;
    for (unsigned i = 0; i < p.Count(); ++i)
        paths.push_back(p.Entry(i)->path);
    EXPECT_EQ((std::vector<std::string>{PathOf(10), PathOf(1), PathOf(11), PathOf(12), PathOf(13)}), paths);

    // Bad indexes change nothing.
    h.ClearLog();
    EXPECT_EQ(-1, p.RemoveSong(5));
    EXPECT_EQ(-1, p.RemoveSong(static_cast<unsigned>(-1)));
    EXPECT_EQ(-1, p.SetCurrent(5));
    EXPECT_EQ(-1, p.InsertSong(5, &a));  // appending is AddSong's job
    EXPECT_EQ(-1, p.InsertSong(0, nullptr));
    EXPECT_EQ(5, h.CountLog("Bad parameters"));
    EXPECT_EQ(5u, p.Count());
    EXPECT_EQ(2u, p.Current());
}

// "first-last" of a list page's sequence numbers ("" when empty, "gap" when
// not consecutive).
std::string Seqs(const Json::Value &reply)
{
    const Json::Value &u = reply["uris"];
    if (!u.isArray() || u.empty())
        return "";
    for (Json::ArrayIndex i = 1; i < u.size(); ++i)
        if (u[i]["sequence"].asInt() != u[i - 1]["sequence"].asInt() + 1)
            return "gap";
    return u[0]["sequence"].asString() + "-" + u[u.size() - 1]["sequence"].asString();
}

TEST_F(QueueTest, ListPages)
{
    Json::Value empty;
    ASSERT_EQ(0, PlaylistListJson(p, 0, 20, empty));
    EXPECT_TRUE(empty["uris"].isArray());
    Fill(30);
    struct {
        int start, limit;
        const char *seqs;
    } pages[] = {
        {0, 0, "0-29"}, {5, 0, "5-29"}, {5, 10, "5-14"}, {25, 10, "25-29"}, {29, 1, "29-29"}, {30, 0, ""},
        // A negative limit means 20, a negative start 0; huge values neither overflow nor fail.
        {0, -1, "0-19"}, {3, INT_MIN, "3-22"}, {-7, 4, "0-3"}, {INT_MIN, -5, "0-19"},
        {0, INT_MAX, "0-29"}, {10, INT_MAX, "10-29"}, {INT_MAX, INT_MAX, ""},
    };
    for (const auto &pg : pages) {
        Json::Value r;
        EXPECT_EQ(0, PlaylistListJson(p, pg.start, pg.limit, r));
        EXPECT_EQ(pg.seqs, Seqs(r)) << pg.start << " " << pg.limit;
        EXPECT_TRUE(r["uris"].isArray());
        EXPECT_EQ(30, r["total"].asInt());
    }
}

}  // namespace
