// Inputs that a broken or hostile hand gives the daemon: radio lists and
// custom-slot files nested deep enough to exhaust a recursive parser, radio
// lists far larger than any household keeps, and a queue filled past its
// limit. The daemon refuses each with one log line and keeps serving; the
// bounded reader refuses what no caller should get.
#include <gtest/gtest.h>

#include <cstring>
#include <string>

#include <json/json.h>

#include "daemon/tarn_types.h"
#include "platform/json_read.h"
#include "source/radiolist.h"
#include <unistd.h>

#include "tests/harness/harness.h"

namespace {

const char kSlots[] = "/usr/tarn/etc/audio/custom_slots.json";

TEST(BoundedJson, RefusesDeepLongAndBrokenTextsAndReadsTheRest)
{
    struct Case { std::string text; size_t max; bool ok; } cases[] = {
        {"{\"stations\": [{\"name\": \"a\"}], \"total\": 1} // a comment", 1024, true},
        {"{\"s\": \"[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[\"}", 1024, true},
        {std::string(JSON_READ_MAX_DEPTH, '[') + std::string(JSON_READ_MAX_DEPTH, ']'), 1024, true},
        {std::string(JSON_READ_MAX_DEPTH + 1, '[') + std::string(JSON_READ_MAX_DEPTH + 1, ']'), 1024, false},
        {"{\"stations\":" + std::string(1000, '['), 1 << 20, false},
        {std::string(200000, '{'), 1 << 20, false},
        {"[1, 2, 3]", 4, false},
        {"{\"a\": ", 1024, false},
        {"", 1024, false},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.text.substr(0, 60));
        Json::Value v(7);
        std::string why;
        EXPECT_EQ(c.ok ? 0 : -1, JsonParseBounded(c.text, c.max, JSON_READ_MAX_DEPTH, &v, &why));
        if (!c.ok) {
            EXPECT_TRUE(v.isNull());
            EXPECT_FALSE(why.empty());
        }
    }
}

std::string Nested(const std::string &prefix, int depth)
{
    return prefix + std::string(depth, '[');
}

std::string StationList(int n)
{
    std::string text = "{\"stations\": [";
    for (int i = 0; i < n; i++)
        text += std::string(i ? "," : "") + "{\"name\": \"S" + std::to_string(i) +
                "\", \"url\": \"http://127.0.0.1:9/" + std::to_string(i) + "\", \"desc\": \"\"}";
    return text + "], \"total\": " + std::to_string(n) + "}";
}

class HostileFiles : public ::testing::Test {
protected:
    tarntest::Harness h;

    void ExpectServing()
    {
        std::string reply;
        ASSERT_EQ(0, h.Request(ACT_GET_STATUS, nullptr, &reply, 2000)) << "the daemon stopped serving";
        Json::Value st;
        EXPECT_TRUE(Json::Reader().parse(reply, st)) << reply;
    }
};

TEST_F(HostileFiles, NestedListsAndSlotsAreRefusedNotFatal)
{
    ASSERT_EQ(0, h.WriteFile(TARN_RADIO_FAVORITE, Nested("{\"stations\":", 1000)));
    ASSERT_EQ(0, h.WriteFile(kSlots, Nested("{\"slots\": {\"1\": ", 5000)));
    ASSERT_EQ(0, h.Start()) << h.Error();
    std::string reply;
    EXPECT_EQ(0, h.Request(ACT_SOURCE_RADIO, nullptr, &reply, 3000)) << h.Log();
    ExpectServing();
    // An empty favourite list sends the change on to the user's own list.
    ASSERT_EQ(0, h.WriteFile(TARN_RADIO_FAVORITE, StationList(0)));
    ASSERT_EQ(0, h.WriteFile(TARN_RADIO_USERDEF, Nested("", 100000)));
    EXPECT_EQ(0, h.Request(ACT_SOURCE_RADIO, nullptr, &reply, 3000)) << h.Log();
    ExpectServing();
    EXPECT_EQ(0, h.Request(ACT_SOURCE_CUSTOM, "1", &reply, 3000)) << h.Log();
    ExpectServing();
    EXPECT_EQ(1, h.CountLog("favorite.json]: nested deeper than")) << h.Log();
    EXPECT_EQ(1, h.CountLog("userdef.json]: nested deeper than")) << h.Log();
    EXPECT_EQ(1, h.CountLog("custom_slots.json is damaged: nested deeper than")) << h.Log();
    EXPECT_EQ(0, h.Stop()) << "the daemon did not end cleanly";
}

TEST_F(HostileFiles, OversizedRadioListsAreRefusedByTheConfiguredLimits)
{
    ASSERT_EQ(0, h.WriteFile(TARN_INFO_CONF, "radio_list_max_stations=50\nradio_list_max_bytes=4096\n"));
    ASSERT_EQ(0, h.WriteFile(TARN_RADIO_FAVORITE, StationList(51)));       // too many stations
    ASSERT_EQ(0, h.Start()) << h.Error();
    std::string reply;
    EXPECT_EQ(0, h.Request(ACT_SOURCE_RADIO, nullptr, &reply, 3000));
    ExpectServing();
    ASSERT_EQ(0, h.WriteFile(TARN_RADIO_FAVORITE, StationList(0)));
    ASSERT_EQ(0, h.WriteFile(TARN_RADIO_USERDEF, StationList(10) + std::string(5000, ' ')));  // too long
    EXPECT_EQ(0, h.Request(ACT_SOURCE_RADIO, nullptr, &reply, 3000));
    ExpectServing();
    EXPECT_EQ(1, h.CountLog("holds 51 stations, more than radio_list_max_stations (50)")) << h.Log();
    EXPECT_EQ(1, h.CountLog("userdef.json]: file is over the limit of 4096 bytes")) << h.Log();
    ASSERT_EQ(0, h.Request(ACT_QUEUE_LIST, "0 14", &reply, 2000));
    Json::Value q;
    ASSERT_TRUE(Json::Reader().parse(reply, q)) << reply;
    EXPECT_EQ(0, q["total"].asInt()) << reply;

    // Within the limits the same lists play.
    ASSERT_EQ(0, h.WriteFile(TARN_INFO_CONF, "radio_list_max_stations=60\nradio_list_max_bytes=100000\n"));
    ASSERT_EQ(0, h.WriteFile(TARN_RADIO_FAVORITE, StationList(51)));
    EXPECT_EQ(0, h.Request(ACT_SOURCE_RADIO, nullptr, &reply, 3000));
    ASSERT_EQ(0, h.Request(ACT_QUEUE_LIST, "0 14", &reply, 2000));
    ASSERT_TRUE(Json::Reader().parse(reply, q)) << reply;
    EXPECT_EQ(51, q["total"].asInt()) << reply;
    EXPECT_EQ(0, h.Stop());
}

TEST(QueueLimit, SongsPastTheLimitAreRefusedWithAReason)
{
    tarntest::Harness h;
    ASSERT_EQ(0, h.WriteFile(TARN_INFO_CONF, "audio_queue_max=5\n"));
    ASSERT_EQ(0, h.Start()) << h.Error();
    for (int i = 0; i < 5; i++)
        ASSERT_EQ(0, h.QueueAdd(tarntest::MakeMediaInfo("/music/" + std::to_string(i) + ".mp3")));
    std::string reply;
    Json::Value v;
    ControlRequest add = tarntest::MakeRequest(ACT_QUEUE_ADD);
    TARN_MEDIA_INFO extra = tarntest::MakeMediaInfo("/music/extra.mp3");
    memcpy(add.parameter, &extra, sizeof(extra));
    ASSERT_EQ(0, h.RequestRaw(add, &reply));
    ASSERT_TRUE(Json::Reader().parse(reply, v)) << reply;
    EXPECT_EQ("the queue is full: 5 songs (audio_queue_max)", v["error"].asString()) << reply;
    EXPECT_EQ(1, h.CountLog("The queue is full: 5 songs")) << h.Log();
    ASSERT_EQ(0, h.Request(ACT_QUEUE_LIST, "0 10", &reply));
    ASSERT_TRUE(Json::Reader().parse(reply, v)) << reply;
    EXPECT_EQ(5, v["total"].asInt());
    // Room again after a removal.
    ASSERT_EQ(0, h.Request(ACT_QUEUE_REMOVE, "0"));
    ASSERT_EQ(0, h.RequestRaw(add, &reply));
    ASSERT_TRUE(Json::Reader().parse(reply, v)) << reply;
    EXPECT_FALSE(v.isMember("error")) << reply;
    EXPECT_EQ(0, h.Stop());
}

// A queue where nothing can be played (streams that refuse the connection),
// with Repeat One and Repeat All: each song is tried once, then the player
// stops with the reason, instead of trying them again every second.
TEST(UnplayableQueue, EverySongFailingStopsThePlayerWithTheReason)
{
    for (const char *mode : {"2", "3"}) {
        SCOPED_TRACE(std::string("repeat mode ") + mode);
        tarntest::Harness h;
        ASSERT_EQ(0, h.Start()) << h.Error();
        for (const char *url : {"http://127.0.0.1:9/gone-a.mp3", "http://127.0.0.1:9/gone-b.mp3"})
            ASSERT_EQ(0, h.QueueAdd(tarntest::MakeMediaInfo(url)));
        ASSERT_EQ(0, h.Request(ACT_SET_REPEAT_MODE, mode));
        ASSERT_EQ(0, h.Request(ACT_PLAY_INDEX, "0"));
        EXPECT_TRUE(h.WaitLog("No song of the queue could be played", 20000)) << h.Log();
        std::string reply;
        Json::Value v;
        ASSERT_EQ(0, h.Request(ACT_GET_STATUS, "", &reply));
        ASSERT_TRUE(Json::Reader().parse(reply, v)) << reply;
        EXPECT_NE(std::string::npos, v["last_error"].asString().find("127.0.0.1:9/gone-")) << reply;
        int tries = h.CountLog("Failed to play [");
        usleep(3000 * 1000);
        EXPECT_EQ(tries, h.CountLog("Failed to play [")) << "the player kept trying";
        EXPECT_LE(tries, 3) << h.Log();
        EXPECT_NE(PLAYER_STATE_PLAYING, h.PublishedSegment()->state);
        EXPECT_EQ(0, h.Stop());
    }
}

}  // namespace
