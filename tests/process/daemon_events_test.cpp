// The loop sleeps until there is work: clients that connect and stay silent,
// or send a byte at a time, never delay a good client; each is closed at its
// own deadline and leaves no descriptor behind; SIGTERM ends a wait at once.
#include <gtest/gtest.h>

#include <poll.h>
#include <signal.h>
#include <unistd.h>

#include <string>
#include <thread>
#include <vector>

#include <json/json.h>

#include "daemon/tarn_types.h"
#include "tests/harness/harness.h"

namespace {

class EventsTest : public ::testing::Test {
protected:
    tarntest::Harness h;
    void SetUp() override { ASSERT_EQ(0, h.Start()) << h.Error(); }

    // Reads a whole reply from fd, waiting at most timeoutMs.
    static size_t ReadReply(int fd, int timeoutMs)
    {
        char buf[CTRL_REPLY_SIZE];
        size_t got = 0;
        while (got < sizeof(buf)) {
            struct pollfd p = {fd, POLLIN, 0};
            if (poll(&p, 1, timeoutMs) <= 0)
                break;
            ssize_t n = read(fd, buf + got, sizeof(buf) - got);
            if (n <= 0)
                break;
            got += static_cast<size_t>(n);
        }
        return got;
    }
    // The descriptor is at its end (closed by the daemon) within timeoutMs.
    static bool ClosedByPeer(int fd, int timeoutMs)
    {
        struct pollfd p = {fd, POLLIN, 0};
        char c;
        return poll(&p, 1, timeoutMs) == 1 && read(fd, &c, 1) == 0;
    }
};

TEST_F(EventsTest, SilentAndSlowClientsDoNotHoldBackAGoodOne)
{
    const int fdsBefore = tarntest::CountFds(h.Pid());
    ASSERT_GT(fdsBefore, 0);
    std::vector<int> silent;
    for (int i = 0; i < 200; i++) {
        int fd = h.Connect();
        ASSERT_GE(fd, 0) << "connection " << i;
        silent.push_back(fd);
    }
    // A slow client: one byte now, more later.
    int slow = h.Connect();
    ASSERT_GE(slow, 0);
    ControlRequest req = tarntest::MakeRequest(ACT_GET_STATUS);
    ASSERT_EQ(1, write(slow, &req, 1));

    // Good clients are answered while every silent one is still connected
    // (their 0.5 s has not run out: none of them is closed yet).
    for (int i = 0; i < 5; i++) {
        std::string reply;
        ASSERT_EQ(0, h.Request(ACT_GET_STATUS, nullptr, &reply, 3000)) << "good request " << i;
        EXPECT_NE(std::string::npos, reply.find("\"PlayerState\""));
    }
    for (int fd : silent) {
        struct pollfd p = {fd, POLLIN, 0};
        EXPECT_EQ(0, poll(&p, 1, 0)) << "a silent client was closed before the good ones were answered";
    }

    // At their deadlines every silent client is closed without a log line;
    // the slow one was dropped as a short request when its first byte came.
    for (int fd : silent)
        EXPECT_TRUE(ClosedByPeer(fd, 3000));
    EXPECT_TRUE(ClosedByPeer(slow, 3000));
    for (int fd : silent)
        close(fd);
    close(slow);
    EXPECT_EQ(1, h.CountLog("tarnaudiod:311 Failed to read action")) << h.Log();
    std::string reply;
    ASSERT_EQ(0, h.Request(ACT_GET_STATUS, nullptr, &reply, 3000));
    EXPECT_EQ(fdsBefore, tarntest::CountFds(h.Pid())) << "descriptors leaked";
    EXPECT_EQ(0, h.Stop());
}

TEST_F(EventsTest, RepliesFollowTheOrderRequestsArrive)
{
    // A client that connected first but sends last is answered last; the
    // requests complete in the order they became whole.
    int first = h.Connect(), second = h.Connect();
    ASSERT_GE(first, 0);
    ASSERT_GE(second, 0);
    ControlRequest status = tarntest::MakeRequest(ACT_GET_STATUS);
    ASSERT_EQ(static_cast<ssize_t>(sizeof(status)), write(second, &status, sizeof(status)));
    EXPECT_EQ(static_cast<size_t>(CTRL_REPLY_SIZE), ReadReply(second, 2000));
    ASSERT_EQ(static_cast<ssize_t>(sizeof(status)), write(first, &status, sizeof(status)));
    EXPECT_EQ(static_cast<size_t>(CTRL_REPLY_SIZE), ReadReply(first, 2000));
    close(first);
    close(second);
    EXPECT_EQ(0, h.Stop());
}

TEST_F(EventsTest, SigtermEndsAnIdleWaitAtOnce)
{
    // Nothing to do: the daemon sleeps in its wait, and SIGTERM ends it.
    usleep(300000);
    pid_t pid = h.Pid();
    ASSERT_EQ(0, kill(pid, SIGTERM));
    EXPECT_EQ(0, h.WaitExit(pid, 2000));
    EXPECT_EQ(1, h.CountLog("tarnaudiod exit"));
}

}  // namespace
