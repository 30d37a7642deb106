// Local sockets and the control client calls, against an in-process fake
// daemon listening on the control socket.
#include <gtest/gtest.h>

#include <atomic>
#include <mutex>
#include <chrono>
#include <cstring>
#include <string>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <thread>
#include <unistd.h>
#include <vector>

#include "daemon/ctrl.h"
#include "daemon/socket.h"
#include "daemon/tarn_types.h"
#include "platform/tarn_env.h"
#include "tests/harness/harness.h"

namespace {

using Clock = std::chrono::steady_clock;

long ElapsedMs(Clock::time_point since)
{
    return static_cast<long>(
        std::chrono::duration_cast<std::chrono::milliseconds>(Clock::now() - since).count());
}

// Accepts connections on the control socket in a thread, records each
// request and answers with a fixed reply (or not at all).
class FakeDaemon {
public:
    explicit FakeDaemon(const std::string &replyText, bool answer = true)
        : reply(replyText), answer(answer)
    {
        fd = SocketListen(TarnPath(TARN_CTRL_SOCKET).c_str(), 5);
        if (fd >= 0)
            worker = std::thread([this] { Run(); });
    }
    ~FakeDaemon()
    {
        stop = true;
        if (worker.joinable())
            worker.join();
        if (fd >= 0)
            close(fd);
    }
    int fd = -1;
    // Copies of what arrived so far (the worker appends under the lock).
    std::vector<ControlRequest> Requests()
    {
        std::lock_guard<std::mutex> g(lock);
        return requests;
    }
    std::vector<ssize_t> ReadSizes()
    {
        std::lock_guard<std::mutex> g(lock);
        return readSizes;
    }

private:
    void Run()
    {
        while (!stop) {
            int c = SocketAcceptPoll(fd);
            if (c < 0) {
                usleep(200);
                continue;
            }
            ControlRequest req;
            memset(&req, 0, sizeof(req));
            ssize_t n = read(c, &req, sizeof(req));
            {
                std::lock_guard<std::mutex> g(lock);
                readSizes.push_back(n);
                requests.push_back(req);
            }
            if (answer) {
                char out[CTRL_REPLY_SIZE] = {0};
                snprintf(out, sizeof(out), "%s", reply.c_str());
                ssize_t w = write(c, out, sizeof(out));
                (void)w;
            } else {
                usleep(800000);
            }
            close(c);
        }
    }
    std::string reply;
    bool answer;
    std::atomic<bool> stop{false};
    std::thread worker;
    std::mutex lock;
    std::vector<ControlRequest> requests;
    std::vector<ssize_t> readSizes;
};

class SocketTest : public ::testing::Test {
protected:
    tarntest::Harness h;  // private root and log file for this process
    void SetUp() override { h.ClearLog(); }
};

TEST_F(SocketTest, ListenReplacesStaleSocketFileAndAccepts)
{
    std::string path = h.Path("/tmp/stale.sock");
    // Leave a socket file behind as a crashed run would.
    int old = socket(AF_UNIX, SOCK_STREAM, 0);
    struct sockaddr_un addr;
    memset(&addr, 0, sizeof(addr));
    addr.sun_family = AF_UNIX;
    snprintf(addr.sun_path, sizeof(addr.sun_path), "%s", path.c_str());
    ASSERT_EQ(0, bind(old, reinterpret_cast<struct sockaddr *>(&addr), sizeof(addr)));
    close(old);
    ASSERT_TRUE(h.Exists("/tmp/stale.sock"));

    int fd = SocketListen(path.c_str(), 5);
    ASSERT_GE(fd, 0);
    // Nothing pending: -1 at once and no log line.
    auto t0 = Clock::now();
    EXPECT_EQ(-1, SocketAcceptPoll(fd));
    EXPECT_LT(ElapsedMs(t0), 100);
    EXPECT_EQ("", h.Log());

    int client = socket(AF_UNIX, SOCK_STREAM, 0);
    ASSERT_EQ(0, connect(client, reinterpret_cast<struct sockaddr *>(&addr), sizeof(addr)));
    int accepted = SocketAcceptPoll(fd);
    EXPECT_GE(accepted, 0);
    close(accepted);
    close(client);
    close(fd);
}

TEST_F(SocketTest, LongPathIsCutAt107Characters)
{
    std::string dir = h.Path("/tmp");
    std::string path = dir + "/" + std::string(200, 'p');
    std::string cut = path.substr(0, 107);
    int fd = SocketListen(path.c_str(), 1);
    ASSERT_GE(fd, 0);
    struct stat st;
    ASSERT_EQ(0, stat(cut.c_str(), &st)) << cut;
    EXPECT_TRUE(S_ISSOCK(st.st_mode));
    close(fd);
}

TEST_F(SocketTest, ListenFailuresAndBadDescriptorsAreLogged)
{
    EXPECT_EQ(-1, SocketListen(h.Path("/no/such/dir/x.sock").c_str(), 1));
    EXPECT_EQ(1, h.CountLog("socket:31 Failed to bind socket."));
    EXPECT_EQ(-1, SocketAcceptPoll(-1));
    EXPECT_EQ(1, h.CountLog("socket:58 Bad parameter"));
}

TEST_F(SocketTest, ClientWithoutDaemonFailsWithConnectMessage)
{
    EXPECT_LT(CtrlConnect(), 0);
    EXPECT_EQ(-1, CtrlPlayPause());
    std::string expected = "ctrl:27 Failed to connect to " + h.Path(TARN_CTRL_SOCKET) + ". [";
    EXPECT_EQ(2, h.CountLog(expected)) << h.Log();
}

TEST_F(SocketTest, BadReplyBuffersAreRefusedWithoutConnecting)
{
    FakeDaemon fake("null\n");
    ASSERT_GE(fake.fd, 0);
    ControlRequest req = tarntest::MakeRequest(ACT_STOP);
    char buf[16];
    EXPECT_EQ(-1, CtrlSendRequest(&req, buf, 0));
    EXPECT_EQ(-1, CtrlSendRequest(&req, nullptr, 16));
    EXPECT_EQ(2, h.CountLog("ctrl:45 Bad parameter"));
    EXPECT_EQ(-1, InfoListServers(0, 10, nullptr, 100));
    EXPECT_EQ(-1, InfoListRenderers(0, 10, buf, 0));
    EXPECT_EQ(-1, InfoGetStatus(nullptr, 10));
    EXPECT_EQ(-1, InfoListQueue(0, 10, buf, -1));
    EXPECT_EQ(1, h.CountLog("info:62 Bad parameters"));
    EXPECT_EQ(1, h.CountLog("info:88 Bad parameters"));
    EXPECT_EQ(1, h.CountLog("info:135 Bad parameters"));
    EXPECT_EQ(1, h.CountLog("info:160 Bad parameters"));
    usleep(50000);
    EXPECT_TRUE(fake.Requests().empty());
}

TEST_F(SocketTest, EveryClientCallSendsItsActionAndParameter)
{
    FakeDaemon fake("{\n   \"total\" : 0\n}\n");
    ASSERT_GE(fake.fd, 0);
    char buf[CTRL_REPLY_SIZE];
    struct Expect {
        int rc;
        int action;
        const char *param;  // null: not checked
    };
    std::vector<Expect> expected;
    auto call = [&](int rc, int action, const char *param) { expected.push_back({rc, action, param}); };
    call(CtrlPlayPause(), ACT_PLAY_PAUSE, nullptr);
    call(CtrlStop(), ACT_STOP, nullptr);
    call(CtrlNext(), ACT_NEXT, nullptr);
    call(CtrlPrevious(), ACT_PREVIOUS, nullptr);
    call(CtrlPlayIndex(3), ACT_PLAY_INDEX, "3");
    call(CtrlSeek(-12), ACT_SEEK, "-12");
    call(CtrlMute(), ACT_MUTE, nullptr);
    call(CtrlSetVolume(77), ACT_SET_VOLUME, "77");
    call(CtrlVolumeUp(), ACT_VOLUME_UP, nullptr);
    call(CtrlVolumeDown(), ACT_VOLUME_DOWN, nullptr);
    call(CtrlSourceRandom(), ACT_SOURCE_RANDOM, nullptr);
    call(CtrlSourceRadio(), ACT_SOURCE_RADIO, nullptr);
    call(CtrlSourceIpod(), ACT_SOURCE_IPOD, nullptr);
    call(CtrlSourcePlaylist(), ACT_SOURCE_PLAYLIST, nullptr);
    call(CtrlSourceCustom(4), ACT_SOURCE_CUSTOM, "4");
    call(CtrlSaveCustom(2), ACT_SAVE_CUSTOM, "2");
    call(CtrlSourceNext(), ACT_SOURCE_NEXT, nullptr);
    call(CtrlSourcePrevious(), ACT_SOURCE_PREVIOUS, nullptr);
    call(CtrlClearChanged(), ACT_CLEAR_CHANGED, nullptr);
    call(CtrlSetChanged(), ACT_SET_CHANGED, nullptr);
    const float gains[10] = {0, -3.5f, 10, 1.25f, 0, 0, 0, 0, 0, -12};
    call(CtrlSetEqualizer(gains), ACT_SET_EQUALIZER,
         "0.0 -3.5 10.0 1.2 0.0 0.0 0.0 0.0 0.0 -12.0");
    call(InfoSearchServers(), ACT_SEARCH_SERVERS, nullptr);
    call(InfoSearchRenderers(), ACT_SEARCH_RENDERERS, nullptr);
    call(InfoListServers(5, 20, buf, sizeof(buf)), ACT_LIST_SERVERS, "5 20");
    EXPECT_STREQ("{\n   \"total\" : 0\n}\n", buf);
    call(InfoListRenderers(0, 7, buf, sizeof(buf)), ACT_LIST_RENDERERS, "0 7");
    call(InfoSelectPlayer(-1), ACT_SELECT_PLAYER, "-1");
    call(InfoGetStatus(buf, sizeof(buf)), ACT_GET_STATUS, nullptr);
    call(InfoListQueue(10, 10, buf, sizeof(buf)), ACT_QUEUE_LIST, "10 10");

    for (int i = 0; i < 100 && fake.Requests().size() < expected.size(); ++i)
        usleep(10000);
    std::vector<ControlRequest> got = fake.Requests();
    std::vector<ssize_t> sizes = fake.ReadSizes();
    ASSERT_EQ(expected.size(), got.size());
    for (size_t i = 0; i < expected.size(); ++i) {
        SCOPED_TRACE(i);
        EXPECT_EQ(0, expected[i].rc);
        EXPECT_EQ(CTRL_REQUEST_SIZE, sizes[i]);
        EXPECT_EQ(expected[i].action, got[i].action);
        if (expected[i].param) {
            EXPECT_STREQ(expected[i].param, got[i].parameter);
        }
    }
}

TEST_F(SocketTest, EqualizerTextFormat)
{
    const float zero[10] = {0};
    char text[128];
    CtrlFormatEqualizer(zero, text, sizeof(text));
    EXPECT_STREQ("0.0 0.0 0.0 0.0 0.0 0.0 0.0 0.0 0.0 0.0", text);
    // A small buffer is never overrun and stays terminated.
    char small[8];
    memset(small, 'x', sizeof(small));
    CtrlFormatEqualizer(zero, small, sizeof(small));
    EXPECT_EQ('\0', small[7]);
    EXPECT_STREQ("0.0 0.0", small);
}

TEST_F(SocketTest, SilentDaemonMakesTheCallFailAfterHalfASecond)
{
    FakeDaemon fake("", false);
    ASSERT_GE(fake.fd, 0);
    char buf[64];
    auto t0 = Clock::now();
    EXPECT_EQ(-1, InfoGetStatus(buf, sizeof(buf)));
    long ms = ElapsedMs(t0);
    EXPECT_GE(ms, 450);
    EXPECT_LT(ms, 2000);
    EXPECT_EQ(0, h.CountLog("ctrl:"));  // a time-out is not logged
}

TEST_F(SocketTest, ShortReplyBufferKeepsOnlyTheFirstChunk)
{
    FakeDaemon fake("{\"a\":1}");
    ASSERT_GE(fake.fd, 0);
    char buf[4];
    EXPECT_EQ(0, InfoGetStatus(buf, sizeof(buf)));
    EXPECT_EQ(0, memcmp(buf, "{\"a\"", 4));
}

}  // namespace
