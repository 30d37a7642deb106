// The queue's list pages and its control actions.
#include <gtest/gtest.h>

#include <climits>
#include <cmath>
#include <cstring>
#include <memory>
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

std::string PathOf(int i)
{
    return "/music/song" + std::to_string(i) + ".mp3";
}

// Sequence numbers of a list reply's songs.
std::vector<int> Sequences(const Json::Value &reply)
{
    std::vector<int> v;
    for (const Json::Value &item : reply["uris"])
        v.push_back(item["sequence"].asInt());
    return v;
}

std::vector<int> Range(int from, int to)
{
    std::vector<int> v;
    for (int i = from; i < to; ++i)
        v.push_back(i);
    return v;
}

class ListTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        harness.reset(new tarntest::Harness());
        ASSERT_EQ("", harness->Error());
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
    int Act(int action, const char *text, Json::Value *reply = nullptr)
    {
        ControlRequest req = tarntest::MakeRequest(action, text);
        Json::Value scratch;
        return queue.HandleAction(&req, reply ? *reply : scratch);
    }
    int ActRecord(int action, const TARN_MEDIA_INFO &info, int32_t position = 0)
    {
        ControlRequest req = tarntest::MakeRequest(action);
        memcpy(req.parameter, &info, sizeof(info));
        memcpy(reinterpret_cast<char *>(&req) + CTRL_INSERT_POS_OFFSET, &position, sizeof(position));
        Json::Value reply;
        return queue.HandleAction(&req, reply);
    }
    std::unique_ptr<tarntest::Harness> harness;
    Playlist queue;
};

TEST_F(ListTest, EverySongKeyWithItsType)
{
    TARN_MEDIA_INFO s;
    memset(&s, 0, sizeof(s));
    s.id = 4294967295u;
    snprintf(s.path, sizeof(s.path), "/music/Album/01 First.flac");
    s.track = 1;
    s.disc = 2;
    s.year = 1999;
    snprintf(s.title, sizeof(s.title), "First");
    snprintf(s.album, sizeof(s.album), "Album");
    snprintf(s.artist, sizeof(s.artist), "Artist");
    snprintf(s.genre, sizeof(s.genre), "Jazz");
    snprintf(s.albumArtUrl, sizeof(s.albumArtUrl), "http://host/art.jpg");
    s.duration = 241.97f;
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
    ASSERT_TRUE(reply["uris"].isArray());
    ASSERT_EQ(2u, reply["uris"].size());
    const Json::Value &a = reply["uris"][0];
    EXPECT_EQ(17u, a.size());
    EXPECT_EQ("playing@4294967295", a["item_id"].asString());
    EXPECT_EQ("Album", a["album"].asString());
    EXPECT_EQ("Artist", a["artist"].asString());
    EXPECT_EQ("http://host/art.jpg", a["albumArtURL"].asString());
    EXPECT_EQ("Jazz", a["genre"].asString());
    EXPECT_EQ("playing_root", a["item_pid"].asString());
    EXPECT_EQ("First", a["title"].asString());
    EXPECT_EQ(Json::uintValue, a["bitrate"].type());
    EXPECT_EQ(3000000000u, a["bitrate"].asUInt());
    EXPECT_EQ(Json::intValue, a["duration"].type());
    EXPECT_EQ(241, a["duration"].asInt());
    EXPECT_EQ(Json::intValue, a["channels"].type());
    EXPECT_EQ(2, a["channels"].asInt());
    EXPECT_EQ("/music/Album/01 First.flac", a["res"].asString());
    EXPECT_EQ(44100, a["sample"].asInt());
    EXPECT_EQ(1, a["track"].asInt());
    EXPECT_EQ(2, a["disc"].asInt());
    EXPECT_EQ(1999, a["year"].asInt());
    EXPECT_EQ(Json::stringValue, a["size"].type());
    EXPECT_EQ("12345678901234", a["size"].asString());
    EXPECT_EQ(Json::intValue, a["sequence"].type());
    EXPECT_EQ(0, a["sequence"].asInt());

    const Json::Value &b = reply["uris"][1];
    EXPECT_EQ("playing@1", b["item_id"].asString());
    EXPECT_EQ("modules/Aurelon/images/thumb/thumb_file.png", b["albumArtURL"].asString());
    EXPECT_EQ("song1.mp3", b["title"].asString());
    EXPECT_EQ(-2, b["duration"].asInt());
    EXPECT_EQ(1, b["sequence"].asInt());

    EXPECT_EQ(Json::intValue, reply["total"].type());
    EXPECT_EQ(2, reply["total"].asInt());
    EXPECT_TRUE(reply["current"].isIntegral());
    EXPECT_EQ(0, reply["current"].asInt());
    EXPECT_EQ("Normal", reply["mode"].asString());
    EXPECT_EQ(Json::booleanValue, reply["shuffle"].type());
    EXPECT_FALSE(reply["shuffle"].asBool());
    EXPECT_TRUE(reply["order_index"].isIntegral());
    EXPECT_EQ(0, reply["order_index"].asInt());
}

TEST_F(ListTest, DurationsThatDoNotFitAreZero)
{
    float durations[] = {NAN, INFINITY, -INFINITY, 1e20f, -1e20f, 0.99f};
    for (float d : durations) {
        TARN_MEDIA_INFO s = Song(0);
        s.duration = d;
        ASSERT_EQ(0, queue.AddSong(&s));
    }
    Json::Value reply = List(0, 0);
    for (unsigned i = 0; i < 6; ++i)
        EXPECT_EQ(0, reply["uris"][i]["duration"].asInt()) << i;
}

TEST_F(ListTest, PagesOfTheQueue)
{
    Fill(30);
    EXPECT_EQ(Range(0, 30), Sequences(List(0, 0)));
    EXPECT_EQ(Range(5, 30), Sequences(List(5, 0)));
    EXPECT_EQ(Range(5, 15), Sequences(List(5, 10)));
    EXPECT_EQ(Range(25, 30), Sequences(List(25, 10)));
    // A negative limit means 20, a negative start means 0.
    EXPECT_EQ(Range(0, 20), Sequences(List(0, -1)));
    EXPECT_EQ(Range(3, 23), Sequences(List(3, INT_MIN)));
    EXPECT_EQ(Range(0, 4), Sequences(List(-7, 4)));
    EXPECT_EQ(Range(0, 20), Sequences(List(INT_MIN, -5)));
    // Huge values neither overflow nor fail.
    EXPECT_EQ(Range(0, 30), Sequences(List(0, INT_MAX)));
    EXPECT_EQ(Range(10, 30), Sequences(List(10, INT_MAX)));
    Json::Value past = List(INT_MAX, INT_MAX);
    EXPECT_TRUE(past["uris"].isArray());
    EXPECT_EQ(0u, past["uris"].size());
    EXPECT_EQ(30, past["total"].asInt());
    EXPECT_EQ(0u, List(30, 0)["uris"].size());
    EXPECT_EQ(Range(29, 30), Sequences(List(29, 1)));
}

TEST_F(ListTest, EmptyQueueListsAnEmptyArray)
{
    Json::Value reply = List(0, 20);
    ASSERT_TRUE(reply["uris"].isArray());
    EXPECT_EQ(0u, reply["uris"].size());
    EXPECT_EQ(0, reply["total"].asInt());
    EXPECT_EQ("Normal", reply["mode"].asString());
}

TEST_F(ListTest, QueueActionsThroughControlRequests)
{
    for (int i = 0; i < 4; ++i)
        ASSERT_EQ(0, ActRecord(ACT_QUEUE_ADD, Song(i)));
    ASSERT_EQ(4u, queue.Count());
    EXPECT_EQ(PathOf(3), std::string(queue.Entry(3)->path));

    // The insert position travels inside the record area, at byte 6308.
    ASSERT_EQ(0, ActRecord(ACT_QUEUE_INSERT, Song(9), 2));
    ASSERT_EQ(5u, queue.Count());
    EXPECT_EQ(PathOf(9), std::string(queue.Entry(2)->path));
    // Results of the operations are not passed on: refused inserts answer 0.
    EXPECT_EQ(0, ActRecord(ACT_QUEUE_INSERT, Song(8), 5));
    EXPECT_EQ(0, ActRecord(ACT_QUEUE_INSERT, Song(8), -1));
    EXPECT_EQ(5u, queue.Count());

    ASSERT_EQ(0, Act(ACT_QUEUE_SET_CURRENT, "3"));
    EXPECT_EQ(3u, queue.Current());
    EXPECT_EQ(3u, queue.OrderIndex());
    ASSERT_EQ(0, Act(ACT_QUEUE_REMOVE, "0"));
    EXPECT_EQ(4u, queue.Count());
    EXPECT_EQ(2u, queue.Current());
    EXPECT_EQ(PathOf(9), std::string(queue.Entry(1)->path));

    ASSERT_EQ(0, Act(ACT_SET_REPEAT_MODE, "3"));
    EXPECT_EQ(3, queue.GetMode());
    ASSERT_EQ(0, Act(ACT_SET_REPEAT_MODE, "0"));
    EXPECT_EQ(3, queue.GetMode());
    ASSERT_EQ(0, Act(ACT_CYCLE_REPEAT_MODE, nullptr));
    EXPECT_EQ(1, queue.GetMode());
    ASSERT_EQ(0, Act(ACT_TOGGLE_SHUFFLE, nullptr));
    EXPECT_TRUE(queue.IsShuffle());
    ASSERT_EQ(0, Act(ACT_TOGGLE_SHUFFLE, nullptr));
    EXPECT_FALSE(queue.IsShuffle());

    Json::Value reply;
    ASSERT_EQ(0, Act(ACT_QUEUE_LIST, "1 2", &reply));
    EXPECT_EQ(Range(1, 3), Sequences(reply));
    EXPECT_EQ(4, reply["total"].asInt());
    reply.clear();
    ASSERT_EQ(0, Act(ACT_QUEUE_LIST, "", &reply));
    EXPECT_EQ(Range(0, 4), Sequences(reply));
    reply.clear();
    ASSERT_EQ(0, Act(ACT_QUEUE_LIST, "2", &reply));
    EXPECT_EQ(Range(2, 4), Sequences(reply));
    reply.clear();
    ASSERT_EQ(0, Act(ACT_QUEUE_LIST, "0 -1", &reply));
    EXPECT_EQ(Range(0, 4), Sequences(reply));

    // Only the list action writes into the reply.
    reply = Json::Value("untouched");
    ASSERT_EQ(0, Act(ACT_QUEUE_SET_CURRENT, "1", &reply));
    EXPECT_EQ("untouched", reply.asString());

    ASSERT_EQ(0, Act(ACT_QUEUE_CLEAR, nullptr));
    EXPECT_EQ(0u, queue.Count());
}

TEST_F(ListTest, BadParametersOfActionsAreHarmless)
{
    Fill(3);
    ASSERT_EQ(0, Act(ACT_QUEUE_SET_CURRENT, "2"));
    // Not a number reads as 0; values beyond 32 bits never wrap into range.
    ASSERT_EQ(0, Act(ACT_QUEUE_SET_CURRENT, "abc"));
    EXPECT_EQ(0u, queue.Current());
    ASSERT_EQ(0, Act(ACT_QUEUE_SET_CURRENT, "2"));
    EXPECT_EQ(0, Act(ACT_QUEUE_REMOVE, "4294967296"));
    EXPECT_EQ(0, Act(ACT_QUEUE_REMOVE, "-1"));
    EXPECT_EQ(0, Act(ACT_QUEUE_SET_CURRENT, "4294967297"));
    EXPECT_EQ(3u, queue.Count());
    EXPECT_EQ(2u, queue.Current());
    EXPECT_EQ(0, Act(ACT_SET_REPEAT_MODE, "4294967298"));
    EXPECT_NE(2, queue.GetMode());

    // A parameter area without any terminating NUL.
    ControlRequest req = tarntest::MakeRequest(ACT_QUEUE_REMOVE);
    memset(req.parameter, '7', sizeof(req.parameter));
    Json::Value reply;
    EXPECT_EQ(0, queue.HandleAction(&req, reply));
    req.action = ACT_QUEUE_LIST;
    EXPECT_EQ(0, queue.HandleAction(&req, reply));
    EXPECT_EQ(3u, queue.Count());
}

TEST_F(ListTest, ActionsThatAreNotQueueActionsAreRefused)
{
    Fill(2);
    harness->ClearLog();
    Json::Value reply;
    EXPECT_EQ(-1, Act(ACT_CLEAR_CHANGED, nullptr, &reply));
    EXPECT_EQ(-1, Act(ACT_SET_CHANGED, nullptr, &reply));
    EXPECT_EQ(-1, Act(ACT_PLAY_INDEX, "1", &reply));
    EXPECT_EQ(-1, Act(-3, nullptr, &reply));
    EXPECT_EQ(1, harness->CountLog("Action [28] not handled"));
    EXPECT_EQ(1, harness->CountLog("Action [29] not handled"));
    EXPECT_EQ(1, harness->CountLog("Action [8] not handled"));
    EXPECT_EQ(1, harness->CountLog("Action [-3] not handled"));
    EXPECT_EQ(4, harness->CountLog("playlist:"));
    EXPECT_EQ(-1, queue.HandleAction(nullptr, reply));
    EXPECT_EQ(1, harness->CountLog(" Bad parameter"));
    EXPECT_EQ(2u, queue.Count());
    EXPECT_TRUE(reply.isNull());
}

}  // namespace
