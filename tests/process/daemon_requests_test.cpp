// The control protocol against the real daemon: malformed and hostile
// clients, the dispatch of the daemon's own actions, selection and the
// changed flag.
#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <cstring>
#include <fcntl.h>
#include <poll.h>
#include <string>
#include <sys/socket.h>
#include <thread>
#include <unistd.h>
#include <vector>

#include <json/json.h>

#include "daemon/tarn_types.h"
#include "tests/harness/harness.h"

namespace {

const char kReadFailed[] = "tarnaudiod:311 Failed to read action";

bool ParseJson(const std::string &text, Json::Value &out)
{
    Json::CharReaderBuilder b;
    std::string errs;
    std::unique_ptr<Json::CharReader> r(b.newCharReader());
    return r->parse(text.data(), text.data() + text.size(), &out, &errs);
}

// Bytes that come back on fd until the daemon closes it (at most waitMs).
std::string Drain(int fd, int waitMs)
{
    std::string data;
    auto end = std::chrono::steady_clock::now() + std::chrono::milliseconds(waitMs);
    for (;;) {
        int left = static_cast<int>(std::chrono::duration_cast<std::chrono::milliseconds>(
                                        end - std::chrono::steady_clock::now())
                                        .count());
        if (left <= 0)
            break;
        struct pollfd p = {fd, POLLIN, 0};
        if (poll(&p, 1, left) <= 0)
            break;
        char buf[16384];
        ssize_t n = read(fd, buf, sizeof(buf));
        if (n <= 0)
            break;
        data.append(buf, static_cast<size_t>(n));
    }
    return data;
}

class RequestsTest : public ::testing::Test {
protected:
    tarntest::Harness h;
    void SetUp() override { ASSERT_EQ(0, h.Start()) << h.Error(); }
    void TearDown() override { EXPECT_EQ(0, h.Stop()); }

    // The published changed flag once the loop has written it.
    int PublishedChanged(int expect)
    {
        const PublishedStatusShm *pub = h.PublishedSegment();
        if (!pub)
            return -1;
        for (int i = 0; i < 200 && pub->changed != expect; ++i)
            usleep(5000);
        return pub->changed;
    }
    bool StillAnswers()
    {
        std::string reply;
        Json::Value v;
        return h.Request(ACT_GET_STATUS, nullptr, &reply) == 0 && ParseJson(reply, v) &&
               v.isMember("PlayerState");
    }
};

TEST_F(RequestsTest, ReplyIsOneFixedSizeRecordWithStyledJson)
{
    size_t received = 0;
    std::string reply;
    ControlRequest req = tarntest::MakeRequest(ACT_QUEUE_LIST, "0 10");
    ASSERT_EQ(0, h.SendBytes(&req, sizeof(req), &reply, 3000, &received));
    EXPECT_EQ(static_cast<size_t>(CTRL_REPLY_SIZE), received);
    Json::Value v;
    ASSERT_TRUE(ParseJson(reply, v)) << reply;
    EXPECT_EQ(0, v["total"].asInt());
    // Styled layout: one member per line, ends with a line feed.
    EXPECT_EQ('{', reply[0]);
    EXPECT_EQ('\n', reply.back());
    EXPECT_NE(std::string::npos, reply.find("\n   \"total\" : 0"));
}

TEST_F(RequestsTest, MalformedRequestsGetNoReplyAndTheDaemonGoesOn)
{
    pid_t pid = h.Pid();
    ASSERT_TRUE(StillAnswers());
    int fdsBefore = tarntest::CountFds(pid);
    ASSERT_GT(fdsBefore, 0);

    ControlRequest req = tarntest::MakeRequest(ACT_SET_CHANGED);
    size_t received = 99;
    // Short request.
    EXPECT_EQ(-1, h.SendBytes(&req, 100, nullptr, 2000, &received));
    EXPECT_EQ(0u, received);
    EXPECT_TRUE(h.WaitLog(kReadFailed));
    EXPECT_EQ(1, h.CountLog(kReadFailed));
    // One byte short.
    EXPECT_EQ(-1, h.SendBytes(&req, CTRL_REQUEST_SIZE - 1, nullptr, 2000, &received));
    EXPECT_EQ(0u, received);
    EXPECT_EQ(2, h.CountLog(kReadFailed));
    // A whole request written in two pieces.
    int fd = h.Connect();
    ASSERT_GE(fd, 0);
    ASSERT_EQ(4000, write(fd, &req, 4000));
    usleep(150000);
    ssize_t second = write(fd, reinterpret_cast<char *>(&req) + 4000, sizeof(req) - 4000);
    (void)second;  // the daemon may have closed already
    EXPECT_EQ("", Drain(fd, 2000));
    close(fd);
    EXPECT_EQ(3, h.CountLog(kReadFailed));
    // Nothing sent at all: closed after half a second, nothing logged.
    fd = h.Connect();
    ASSERT_GE(fd, 0);
    auto t0 = std::chrono::steady_clock::now();
    EXPECT_EQ("", Drain(fd, 3000));
    long ms = static_cast<long>(std::chrono::duration_cast<std::chrono::milliseconds>(
                                    std::chrono::steady_clock::now() - t0)
                                    .count());
    EXPECT_GE(ms, 400);
    EXPECT_LT(ms, 2500);
    close(fd);
    EXPECT_EQ(3, h.CountLog(kReadFailed));
    // Neither request took effect.
    EXPECT_EQ(0, PublishedChanged(0));

    EXPECT_TRUE(StillAnswers());
    EXPECT_EQ(fdsBefore, tarntest::CountFds(pid));
}

TEST_F(RequestsTest, UnknownCodesAndUnterminatedParametersAreHarmless)
{
    pid_t pid = h.Pid();
    int fdsBefore = tarntest::CountFds(pid);
    for (int code : {0, 37, -1, 1000000}) {
        SCOPED_TRACE(code);
        std::string reply;
        ASSERT_EQ(0, h.Request(code, nullptr, &reply));
        EXPECT_EQ("null\n", reply);
        EXPECT_EQ(1, h.CountLog("localplayer:576 Action [" + std::to_string(code) + "] not handled"))
            << h.Log();
    }
    // Every parameter byte set, no terminator anywhere.
    for (int code : {ACT_PLAY_INDEX, ACT_SEEK, ACT_SET_VOLUME, ACT_QUEUE_LIST, ACT_LIST_SERVERS,
                     ACT_LIST_RENDERERS, ACT_SELECT_PLAYER, ACT_SOURCE_CUSTOM, ACT_SAVE_CUSTOM,
                     ACT_QUEUE_REMOVE, ACT_SET_REPEAT_MODE, ACT_SET_EQUALIZER, ACT_QUEUE_ADD}) {
        SCOPED_TRACE(code);
        ControlRequest req = tarntest::MakeRequest(code);
        memset(req.parameter, '7', sizeof(req.parameter));
        std::string reply;
        EXPECT_EQ(0, h.RequestRaw(req, &reply));
    }
    std::string reply;
    ASSERT_EQ(0, h.Request(ACT_SELECT_PLAYER, "-1", &reply));
    EXPECT_TRUE(StillAnswers());
    EXPECT_EQ(fdsBefore, tarntest::CountFds(pid));
}

TEST_F(RequestsTest, ClientsThatNeverReadOrCrowdTheBacklog)
{
    pid_t pid = h.Pid();
    int fdsBefore = tarntest::CountFds(pid);
    // Clients that send a request and never read the reply.
    std::vector<int> lazy;
    for (int i = 0; i < 8; ++i) {
        int fd = h.Connect();
        ASSERT_GE(fd, 0);
        ControlRequest req = tarntest::MakeRequest(ACT_QUEUE_LIST, "0 10");
        ASSERT_EQ(static_cast<ssize_t>(sizeof(req)), write(fd, &req, sizeof(req)));
        lazy.push_back(fd);
    }
    // Many more clients at once than the backlog of 5 holds: each gets its
    // answer in turn.
    const int kClients = 24;
    std::atomic<int> answered{0};
    std::vector<std::thread> threads;
    for (int i = 0; i < kClients; ++i) {
        threads.emplace_back([&] {
            int fd = h.Connect();
            if (fd < 0)
                return;
            ControlRequest req = tarntest::MakeRequest(ACT_GET_STATUS);
            if (write(fd, &req, sizeof(req)) == static_cast<ssize_t>(sizeof(req)) &&
                Drain(fd, 20000).size() == CTRL_REPLY_SIZE)
                ++answered;
            close(fd);
        });
    }
    for (std::thread &t : threads)
        t.join();
    EXPECT_EQ(kClients, answered.load());
    for (int fd : lazy)
        close(fd);
    EXPECT_TRUE(StillAnswers());
    EXPECT_EQ(fdsBefore, tarntest::CountFds(pid));
}

TEST_F(RequestsTest, ChangedFlagFollowsItsActionsAndIsPublished)
{
    std::string reply;
    EXPECT_EQ(0, PublishedChanged(0));
    ASSERT_EQ(0, h.Request(ACT_SET_CHANGED, nullptr, &reply));
    EXPECT_EQ("null\n", reply);
    EXPECT_EQ(1, PublishedChanged(1));
    ASSERT_EQ(0, h.Request(ACT_CLEAR_CHANGED, nullptr, &reply));
    EXPECT_EQ(0, PublishedChanged(0));
    // A source change that fails (no media library here) leaves it alone
    // but still answers null.
    ASSERT_EQ(0, h.Request(ACT_SOURCE_NEXT, nullptr, &reply));
    EXPECT_EQ("null\n", reply);
    usleep(50000);
    EXPECT_EQ(0, PublishedChanged(0));
    ASSERT_EQ(0, h.Request(ACT_SET_CHANGED, nullptr, &reply));
    ASSERT_EQ(0, h.Request(ACT_SOURCE_IPOD, nullptr, &reply));
    EXPECT_EQ(1, PublishedChanged(1));
}

TEST_F(RequestsTest, PlayerSelectionRules)
{
    std::string reply;
    // Below -1: logged, nothing changes.
    ASSERT_EQ(0, h.Request(ACT_SELECT_PLAYER, "-2", &reply));
    EXPECT_EQ("null\n", reply);
    EXPECT_EQ(1, h.CountLog("tarnaudiod:378 Bad player index [-2]"));
    // A renderer index past the end of the (empty) renderer list: refused,
    // the local player stays selected and keeps answering.
    ASSERT_EQ(0, h.Request(ACT_SELECT_PLAYER, "3", &reply));
    EXPECT_EQ("null\n", reply);
    Json::Value st;
    ASSERT_EQ(0, h.Request(ACT_GET_STATUS, nullptr, &reply));
    ASSERT_TRUE(ParseJson(reply, st));
    EXPECT_TRUE(st.isMember("PlayerState")) << reply;
    // Local-only actions still reach the local player.
    ASSERT_EQ(0, h.Request(ACT_CYCLE_REPEAT_MODE, nullptr, &reply));
    ASSERT_EQ(0, h.Request(ACT_QUEUE_LIST, "0 1", &reply));
    ASSERT_TRUE(ParseJson(reply, st));
    EXPECT_EQ("Repeat One", st["mode"].asString());
    EXPECT_EQ(0, h.CountLog("not handled"));
    // -1 selects the local player explicitly.
    ASSERT_EQ(0, h.Request(ACT_SELECT_PLAYER, "-1", &reply));
    ASSERT_EQ(0, h.Request(ACT_GET_STATUS, nullptr, &reply));
    ASSERT_TRUE(ParseJson(reply, st));
    EXPECT_TRUE(st.isMember("PlayerState"));
}

TEST_F(RequestsTest, DeviceListsAndSearchesAnswer)
{
    std::string reply;
    Json::Value v;
    ASSERT_EQ(0, h.Request(ACT_SEARCH_SERVERS, nullptr, &reply));
    EXPECT_EQ("null\n", reply);
    ASSERT_EQ(0, h.Request(ACT_SEARCH_RENDERERS, nullptr, &reply));
    EXPECT_EQ("null\n", reply);
    ASSERT_EQ(0, h.Request(ACT_LIST_SERVERS, "0 10", &reply));
    ASSERT_TRUE(ParseJson(reply, v)) << reply;
    EXPECT_TRUE(v.isMember("total"));
    EXPECT_EQ(10, v["limit"].asInt());
    ASSERT_EQ(0, h.Request(ACT_LIST_RENDERERS, "", &reply));
    ASSERT_TRUE(ParseJson(reply, v)) << reply;
    EXPECT_TRUE(v.isMember("total"));
    EXPECT_TRUE(v.isMember("current"));
    EXPECT_EQ(0, v["start"].asInt());
    EXPECT_EQ(0, v["limit"].asInt());
}

TEST_F(RequestsTest, QueueRecordsAndInsertPositionAndCutReplies)
{
    std::string reply;
    Json::Value v;
    ASSERT_EQ(0, h.QueueAdd(tarntest::MakeMediaInfo("/music/a.mp3", "Alpha", "Ann")));
    ASSERT_EQ(0, h.QueueAdd(tarntest::MakeMediaInfo("/music/c.mp3", "Gamma")));
    ASSERT_EQ(0, h.QueueInsert(tarntest::MakeMediaInfo("/music/b.mp3", "Beta"), 1));
    ASSERT_EQ(0, h.Request(ACT_QUEUE_LIST, "0 10", &reply));
    ASSERT_TRUE(ParseJson(reply, v)) << reply;
    ASSERT_EQ(3, v["total"].asInt());
    EXPECT_EQ("Alpha", v["uris"][0]["title"].asString());
    EXPECT_EQ("Ann", v["uris"][0]["artist"].asString());
    EXPECT_EQ("Beta", v["uris"][1]["title"].asString());
    EXPECT_EQ("/music/b.mp3", v["uris"][1]["res"].asString());
    EXPECT_EQ("Gamma", v["uris"][2]["title"].asString());

    // A page too big for one reply is cut to 8191 characters.
    for (int i = 0; i < 20; ++i)
        ASSERT_EQ(0, h.QueueAdd(tarntest::MakeMediaInfo("/music/" + std::string(300, 'x') +
                                                        std::to_string(i) + ".mp3")));
    size_t received = 0;
    ControlRequest req = tarntest::MakeRequest(ACT_QUEUE_LIST, "0 0");
    ASSERT_EQ(0, h.SendBytes(&req, sizeof(req), &reply, 3000, &received));
    EXPECT_EQ(static_cast<size_t>(CTRL_REPLY_SIZE), received);
    EXPECT_EQ(static_cast<size_t>(CTRL_REPLY_SIZE - 1), reply.size());
    EXPECT_FALSE(ParseJson(reply, v));
    // Small pages still work.
    ASSERT_EQ(0, h.Request(ACT_QUEUE_LIST, "20 3", &reply));
    ASSERT_TRUE(ParseJson(reply, v)) << reply;
    EXPECT_EQ(23, v["total"].asInt());
    EXPECT_EQ(3u, v["uris"].size());
}

}  // namespace
