// The control protocol against the real daemon: malformed requests, queue
// records and cut replies.
#include <gtest/gtest.h>

#include <chrono>
#include <cstring>
#include <poll.h>
#include <string>
#include <unistd.h>

#include <json/json.h>

#include "daemon/ctrl.h"
#include "daemon/tarn_types.h"
#include "tests/harness/harness.h"

namespace {

const char kReadFailed[] = "tarnaudiod:311 Failed to read action";

Json::Value Parse(const std::string &text, bool *ok = nullptr)
{
    Json::Value v;
    std::unique_ptr<Json::CharReader> r(Json::CharReaderBuilder().newCharReader());
    bool good = r->parse(text.data(), text.data() + text.size(), &v, nullptr);
    if (ok)
        *ok = good;
    return v;
}

// Bytes that come back on fd until the daemon closes it (at most waitMs).
std::string Drain(int fd, int waitMs)
{
    std::string data;
    char buf[16384];
    struct pollfd p = {fd, POLLIN, 0};
    for (ssize_t n; poll(&p, 1, waitMs) > 0 && (n = read(fd, buf, sizeof(buf))) > 0;)
        data.append(buf, static_cast<size_t>(n));
    return data;
}

class RequestsTest : public ::testing::Test {
protected:
    tarntest::Harness h;
    void SetUp() override { ASSERT_EQ(0, h.Start()) << h.Error(); }
    void TearDown() override { EXPECT_EQ(0, h.Stop()); }

    Json::Value Ask(int action, const char *param = nullptr)
    {
        std::string reply;
        return h.Request(action, param, &reply) == 0 ? Parse(reply) : Json::Value();
    }
    // The published changed flag once the loop has written it.
    int PublishedChanged(int expect)
    {
        const PublishedStatusShm *pub = h.PublishedSegment();
        for (int i = 0; pub && i < 200 && pub->changed != expect; ++i)
            usleep(5000);
        return pub ? pub->changed : -1;
    }
    bool StillAnswers() { return Ask(ACT_GET_STATUS).isMember("PlayerState"); }
};

TEST_F(RequestsTest, MalformedRequestsGetNoReplyAndTheDaemonGoesOn)
{
    pid_t pid = h.Pid();
    ASSERT_TRUE(StillAnswers());
    int fdsBefore = tarntest::CountFds(pid);
    ASSERT_GT(fdsBefore, 0);
    ControlRequest req = tarntest::MakeRequest(ACT_SET_CHANGED);
    // Short, one byte short (8195), and a request in two pieces.
    size_t received = 99;
    for (size_t len : {size_t(100), size_t(CTRL_REQUEST_SIZE - 1)}) {
        EXPECT_EQ(-1, h.SendBytes(&req, len, nullptr, 2000, &received));
        EXPECT_EQ(0u, received);
    }
    int fd = h.Connect();
    ASSERT_GE(fd, 0);
    ASSERT_EQ(4000, write(fd, &req, 4000));
    usleep(150000);
    ssize_t second = write(fd, reinterpret_cast<char *>(&req) + 4000, sizeof(req) - 4000);
    (void)second;  // the daemon may have closed already
    EXPECT_EQ("", Drain(fd, 2000));
    close(fd);
    EXPECT_EQ(3, h.CountLog(kReadFailed));
    // Nothing sent: closed after half a second, nothing logged.
    fd = h.Connect();
    ASSERT_GE(fd, 0);
    auto t0 = std::chrono::steady_clock::now();
    EXPECT_EQ("", Drain(fd, 3000));
    auto ms = std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::steady_clock::now() - t0).count();
    EXPECT_GE(ms, 400);
    EXPECT_LT(ms, 2500);
    close(fd);
    EXPECT_EQ(3, h.CountLog(kReadFailed));
    EXPECT_EQ(0, PublishedChanged(0)) << "none of them took effect";

    // Unknown codes are answered null and logged.
    for (int code : {0, 37, -1}) {
        std::string reply;
        ASSERT_EQ(0, h.Request(code, nullptr, &reply));
        EXPECT_EQ("null\n", reply);
        EXPECT_EQ(1, h.CountLog("localplayer:576 Action [" + std::to_string(code) + "] not handled")) << h.Log();
    }
    // Every parameter byte set, no terminator anywhere.
    for (int code : {ACT_PLAY_INDEX, ACT_SEEK, ACT_SET_VOLUME, ACT_QUEUE_LIST, ACT_LIST_SERVERS,
                     ACT_LIST_RENDERERS, ACT_SELECT_PLAYER, ACT_SOURCE_CUSTOM, ACT_SAVE_CUSTOM,
                     ACT_QUEUE_REMOVE, ACT_SET_REPEAT_MODE, ACT_SET_EQUALIZER, ACT_QUEUE_ADD}) {
        ControlRequest bad = tarntest::MakeRequest(code);
        memset(bad.parameter, '7', sizeof(bad.parameter));
        EXPECT_EQ(0, h.RequestRaw(bad, nullptr)) << code;
    }
    EXPECT_TRUE(StillAnswers());
    EXPECT_EQ(fdsBefore, tarntest::CountFds(pid));
}

TEST_F(RequestsTest, QueueRecordsInsertPositionAndCutReplies)
{
    ASSERT_EQ(0, h.QueueAdd(tarntest::MakeMediaInfo("/music/a.mp3", "Alpha", "Ann")));
    ASSERT_EQ(0, h.QueueAdd(tarntest::MakeMediaInfo("/music/c.mp3", "Gamma")));
    ASSERT_EQ(0, h.QueueInsert(tarntest::MakeMediaInfo("/music/b.mp3", "Beta"), 1));
    std::string reply;
    size_t received = 0;
    ControlRequest req = tarntest::MakeRequest(ACT_QUEUE_LIST, "0 10");
    ASSERT_EQ(0, h.SendBytes(&req, sizeof(req), &reply, 3000, &received));
    EXPECT_EQ(static_cast<size_t>(CTRL_REPLY_SIZE), received);
    // Indented JSON: one member per line, ends with a line feed.
    EXPECT_EQ('{', reply[0]);
    EXPECT_EQ('\n', reply.back());
    EXPECT_NE(std::string::npos, reply.find("\n   \"total\": 3")) << reply;
    Json::Value v = Parse(reply);
    EXPECT_EQ("Ann", v["uris"][0]["artist"].asString());
    EXPECT_EQ("/music/b.mp3", v["uris"][1]["res"].asString());
    EXPECT_EQ("Gamma", v["uris"][2]["title"].asString());

    // A page too big for one reply is cut by whole entries: it still parses,
    // and "total" tells the whole length.
    for (int i = 0; i < 20; ++i)
        ASSERT_EQ(0, h.QueueAdd(tarntest::MakeMediaInfo("/music/" + std::string(300, 'x') + std::to_string(i) + ".mp3")));
    req = tarntest::MakeRequest(ACT_QUEUE_LIST, "0 0");
    ASSERT_EQ(0, h.SendBytes(&req, sizeof(req), &reply, 3000, &received));
    EXPECT_EQ(static_cast<size_t>(CTRL_REPLY_SIZE), received);
    bool ok = false;
    v = Parse(reply, &ok);
    ASSERT_TRUE(ok) << reply;
    EXPECT_EQ(23, v["total"].asInt());
    EXPECT_GT(v["uris"].size(), 3u);
    EXPECT_LT(v["uris"].size(), 23u);
    for (Json::ArrayIndex i = 0; i < v["uris"].size(); ++i)
        EXPECT_EQ(static_cast<int>(i), v["uris"][i]["sequence"].asInt());
    v = Ask(ACT_QUEUE_LIST, "20 3");
    EXPECT_EQ(23, v["total"].asInt());
    EXPECT_EQ(3u, v["uris"].size());

    // Non-ASCII text goes out as it is, not six bytes a character: a path of
    // 4,095 bytes of two-byte characters fits a page of one; control
    // characters are escaped and come back as they were.
    ASSERT_EQ(0, h.Request(ACT_QUEUE_CLEAR));
    std::string accented;
    while (accented.size() + 2 <= 4094)
        accented += "\xc3\xa9";
    ASSERT_EQ(0, h.QueueAdd(tarntest::MakeMediaInfo("/" + accented, "caf\xc3\xa9")));
    ASSERT_EQ(0, h.QueueAdd(tarntest::MakeMediaInfo("/music/tab\there\x01.mp3", "new\nline")));
    v = Ask(ACT_QUEUE_LIST, "0 1");
    ASSERT_EQ(1u, v["uris"].size());
    EXPECT_EQ("/" + accented, v["uris"][0]["res"].asString());
    v = Ask(ACT_QUEUE_LIST, "1 1");
    EXPECT_EQ("/music/tab\there\x01.mp3", v["uris"][0]["res"].asString());
    EXPECT_EQ("new\nline", v["uris"][0]["title"].asString());
}

TEST_F(RequestsTest, ChangedFlagAndPlayerSelectionRules)
{
    EXPECT_EQ(0, PublishedChanged(0));
    ASSERT_EQ(0, h.Request(ACT_SET_CHANGED));
    EXPECT_EQ(1, PublishedChanged(1));
    ASSERT_EQ(0, h.Request(ACT_CLEAR_CHANGED));
    EXPECT_EQ(0, PublishedChanged(0));
    // A failing source change (no media library) leaves the flag alone.
    ASSERT_EQ(0, h.Request(ACT_SOURCE_NEXT));
    usleep(50000);
    EXPECT_EQ(0, PublishedChanged(0));
    // Below -1 is logged; a renderer past the end is refused; the local
    // player stays selected and takes its own actions.
    ASSERT_EQ(0, h.Request(ACT_SELECT_PLAYER, "-2"));
    EXPECT_EQ(1, h.CountLog("tarnaudiod:378 Bad player index [-2]"));
    ASSERT_EQ(0, h.Request(ACT_SELECT_PLAYER, "3"));
    ASSERT_EQ(0, h.Request(ACT_CYCLE_REPEAT_MODE));
    EXPECT_EQ("Repeat One", Ask(ACT_QUEUE_LIST, "0 1")["mode"].asString());
    EXPECT_EQ(0, h.CountLog("not handled"));
}

TEST_F(RequestsTest, ClientCallsAgainstTheDaemonAndWithoutIt)
{
    char buf[CTRL_REPLY_SIZE];
    EXPECT_EQ(0, CtrlSetVolume(40));
    EXPECT_EQ(0, InfoGetStatus(buf, sizeof(buf)));
    EXPECT_EQ(40, Parse(buf)["Volume"].asInt());
    EXPECT_EQ(0, InfoListRenderers(0, 5, buf, sizeof(buf)));
    EXPECT_EQ(5, Parse(buf)["limit"].asInt());
    const float gains[10] = {0};
    for (int rc : {CtrlVolumeUp(), CtrlMute(), CtrlSeek(5), CtrlNext(), CtrlPrevious(), CtrlStop(),
                   CtrlSetEqualizer(gains), InfoSearchServers(), InfoSelectPlayer(-1), CtrlSaveCustom(1)})
        EXPECT_EQ(0, rc);
    EXPECT_TRUE(StillAnswers());
    // With the daemon gone the calls fail and tarnctl says how to start it.
    EXPECT_EQ(0, h.Stop());
    EXPECT_EQ(-1, CtrlStop());
    std::string out;
    EXPECT_EQ(1, h.Run({tarntest::BinPath("tarnctl"), "status"}, &out));
    EXPECT_NE(std::string::npos, out.find("tarnaudiod is not running")) << out;
    ASSERT_EQ(0, h.Start()) << h.Error();  // for TearDown
}

}  // namespace
