// The queue's list pages and its control actions.
#include <gtest/gtest.h>

#include <climits>
#include <cstring>
#include <string>

#include "player/playlist.h"
#include "player/tarn_rand.h"
#include "tests/harness/harness.h"

namespace {

TARN_MEDIA_INFO Song(int i)
{
    TARN_MEDIA_INFO info = tarntest::MakeMediaInfo("/music/song" + std::to_string(i) + ".mp3");
    info.id = static_cast<uint32_t>(i);
    return info;
}

// "first-last" of a reply's sequence numbers ("" when empty), checked to be
// consecutive.
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

class ListTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        ASSERT_EQ("", h.Error());
        TarnRandReset();
    }
    void Fill(int n)
    {
        for (int i = 0; i < n; ++i) {
            TARN_MEDIA_INFO s = Song(i);
            ASSERT_EQ(0, queue.AddSong(&s));
        }
    }
    Json::Value List(int start, int limit)
    {
        Json::Value reply;
        EXPECT_EQ(0, queue.ListJson(start, limit, reply));
        return reply;
    }
    int Act(int action, const char *text, Json::Value *reply = nullptr, const TARN_MEDIA_INFO *info = nullptr,
            int32_t position = 0)
    {
        ControlRequest req = tarntest::MakeRequest(action, text);
        if (info) {
            memcpy(req.parameter, info, sizeof(*info));
            memcpy(reinterpret_cast<char *>(&req) + CTRL_INSERT_POS_OFFSET, &position, sizeof(position));
        }
        Json::Value scratch;
        return queue.HandleAction(&req, reply ? *reply : scratch);
    }
    tarntest::Harness h;
    Playlist queue;
};

TEST_F(ListTest, EverySongKeyWithItsType)
{
    TARN_MEDIA_INFO s = tarntest::MakeMediaInfo("/music/Album/01 First.flac", "First", "Artist", 241.97f);
    s.id = 4294967295u;
    s.track = 1;
    s.disc = 2;
    s.year = 1999;
    snprintf(s.album, sizeof(s.album), "Album");
    snprintf(s.genre, sizeof(s.genre), "Jazz");
    snprintf(s.albumArtUrl, sizeof(s.albumArtUrl), "http://host/art.jpg");
    s.bitrate = 3000000000u;
    s.sample = 44100;
    s.channels = 2;
    s.size = 12345678901234ull;
    ASSERT_EQ(0, queue.AddSong(&s));
    TARN_MEDIA_INFO t = Song(1);
    t.title[0] = '\0';
    t.duration = -2.7f;
    ASSERT_EQ(0, queue.AddSong(&t));

    Json::Value reply = List(0, 0);
    const Json::Value &a = reply["uris"][0];
    EXPECT_EQ(17u, a.size());
    Json::StreamWriterBuilder w;
    w["indentation"] = "";
    EXPECT_EQ("{\"album\":\"Album\",\"albumArtURL\":\"http://host/art.jpg\",\"artist\":\"Artist\","
              "\"bitrate\":3000000000,\"channels\":2,\"disc\":2,\"duration\":241,\"genre\":\"Jazz\","
              "\"item_id\":\"playing@4294967295\",\"item_pid\":\"playing_root\",\"res\":\"/music/Album/01 First.flac\","
              "\"sample\":44100,\"sequence\":0,\"size\":\"12345678901234\",\"title\":\"First\",\"track\":1,"
              "\"year\":1999}",
              Json::writeString(w, a));
    const Json::Value &b = reply["uris"][1];
    EXPECT_EQ("modules/Aurelon/images/thumb/thumb_file.png", b["albumArtURL"].asString());
    EXPECT_EQ("song1.mp3", b["title"].asString());
    EXPECT_EQ(-2, b["duration"].asInt());
    EXPECT_EQ(Json::intValue, reply["total"].type());
    EXPECT_EQ(2, reply["total"].asInt());
    EXPECT_EQ("Normal", reply["mode"].asString());
    EXPECT_EQ(Json::booleanValue, reply["shuffle"].type());
    EXPECT_EQ(0, reply["order_index"].asInt());
}

TEST_F(ListTest, PagesOfTheQueue)
{
    EXPECT_TRUE(List(0, 20)["uris"].isArray());
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
        Json::Value r = List(pg.start, pg.limit);
        EXPECT_EQ(pg.seqs, Seqs(r)) << pg.start << " " << pg.limit;
        EXPECT_TRUE(r["uris"].isArray());
        EXPECT_EQ(30, r["total"].asInt());
    }
}

TEST_F(ListTest, QueueActionsThroughControlRequests)
{
    for (int i = 0; i < 4; ++i) {
        TARN_MEDIA_INFO s = Song(i);
        ASSERT_EQ(0, Act(ACT_QUEUE_ADD, nullptr, nullptr, &s));
    }
    // The insert position travels inside the record area, at byte 6308;
    // refused inserts still answer 0.
    TARN_MEDIA_INFO s9 = Song(9);
    ASSERT_EQ(0, Act(ACT_QUEUE_INSERT, nullptr, nullptr, &s9, 2));
    EXPECT_STREQ("/music/song9.mp3", queue.Entry(2)->path);
    EXPECT_EQ(0, Act(ACT_QUEUE_INSERT, nullptr, nullptr, &s9, 5));
    EXPECT_EQ(0, Act(ACT_QUEUE_INSERT, nullptr, nullptr, &s9, -1));
    EXPECT_EQ(5u, queue.Count());

    ASSERT_EQ(0, Act(ACT_QUEUE_SET_CURRENT, "3"));
    ASSERT_EQ(0, Act(ACT_QUEUE_REMOVE, "0"));
    EXPECT_EQ(2u, queue.OrderIndex());
    ASSERT_EQ(0, Act(ACT_SET_REPEAT_MODE, "3"));
    ASSERT_EQ(0, Act(ACT_SET_REPEAT_MODE, "0"));
    EXPECT_EQ(3, queue.GetMode());
    ASSERT_EQ(0, Act(ACT_CYCLE_REPEAT_MODE, nullptr));
    EXPECT_EQ(1, queue.GetMode());
    ASSERT_EQ(0, Act(ACT_TOGGLE_SHUFFLE, nullptr));
    EXPECT_TRUE(queue.IsShuffle());
    ASSERT_EQ(0, Act(ACT_TOGGLE_SHUFFLE, nullptr));

    const std::pair<const char *, const char *> lists[] = {{"1 2", "1-2"}, {"", "0-3"}, {"2", "2-3"}, {"0 -1", "0-3"}};
    for (const auto &pg : lists) {
        Json::Value reply;
        ASSERT_EQ(0, Act(ACT_QUEUE_LIST, pg.first, &reply));
        EXPECT_EQ(pg.second, Seqs(reply)) << pg.first;
    }
    Json::Value reply;
    // Bad parameters: not a number reads as 0; beyond 32 bits never wraps.
    ASSERT_EQ(0, Act(ACT_QUEUE_SET_CURRENT, "abc"));
    EXPECT_EQ(0u, queue.Current());
    ASSERT_EQ(0, Act(ACT_QUEUE_SET_CURRENT, "2"));
    for (const char *bad : {"4294967296", "-1"})
        EXPECT_EQ(0, Act(ACT_QUEUE_REMOVE, bad));
    EXPECT_EQ(0, Act(ACT_QUEUE_SET_CURRENT, "4294967297"));
    EXPECT_EQ(2u, queue.Current());
    EXPECT_EQ(0, Act(ACT_SET_REPEAT_MODE, "4294967298"));
    EXPECT_NE(2, queue.GetMode());
    ControlRequest req = tarntest::MakeRequest(ACT_QUEUE_REMOVE);
    memset(req.parameter, '7', sizeof(req.parameter));  // no NUL anywhere
    EXPECT_EQ(0, queue.HandleAction(&req, reply));
    req.action = ACT_QUEUE_LIST;
    EXPECT_EQ(0, queue.HandleAction(&req, reply));
    EXPECT_EQ(4u, queue.Count());

    // Actions that are not queue actions are refused and logged.
    h.ClearLog();
    reply = Json::Value();
    for (int action : {int(ACT_CLEAR_CHANGED), int(ACT_SET_CHANGED), int(ACT_PLAY_INDEX), -3}) {
        EXPECT_EQ(-1, Act(action, "1", &reply));
        EXPECT_EQ(1, h.CountLog("Action [" + std::to_string(action) + "] not handled"));
    }
    EXPECT_EQ(-1, queue.HandleAction(nullptr, reply));
    EXPECT_EQ(5, h.CountLog("playlist:"));
    EXPECT_TRUE(reply.isNull());
    ASSERT_EQ(0, Act(ACT_QUEUE_CLEAR, nullptr));
    EXPECT_EQ(0u, queue.Count());
}

}  // namespace
