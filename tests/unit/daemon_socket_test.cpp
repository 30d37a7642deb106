// Local sockets and the control client calls, against an in-process fake
// daemon listening on the control socket.
#include <gtest/gtest.h>

#include <atomic>
#include <cstring>
#include <mutex>
#include <string>
#include <thread>
#include <fcntl.h>
#include <poll.h>
#include <unistd.h>
#include <vector>

#include "platform/fd_read.h"
#include "daemon/ctrl.h"
#include "daemon/ctrl_conns.h"
#include "daemon/socket.h"
#include "daemon/tarn_types.h"
#include "platform/tarn_env.h"
#include "tests/harness/harness.h"

namespace {

// Accepts on the control socket in a thread, records each request with the
// size read, and answers with a fixed reply.
class FakeDaemon {
public:
    explicit FakeDaemon(const std::string &reply) : reply(reply)
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
        close(fd);
    }
    std::vector<std::pair<ssize_t, ControlRequest>> Requests()
    {
        std::lock_guard<std::mutex> g(lock);
        return requests;
    }
    int fd = -1;

private:
    void Run()
    {
        while (!stop) {
            int c = SocketAcceptPoll(fd);
            if (c < 0) {
                usleep(200);
                continue;
            }
            ControlRequest req = tarntest::MakeRequest(0);
            ssize_t n = read(c, &req, sizeof(req));
            {
                std::lock_guard<std::mutex> g(lock);
                requests.push_back({n, req});
            }
            char out[CTRL_REPLY_SIZE] = {0};
            snprintf(out, sizeof(out), "%s", reply.c_str());
            (void)!write(c, out, sizeof(out));
            close(c);
        }
    }
    std::string reply;
    std::atomic<bool> stop{false};
    std::thread worker;
    std::mutex lock;
    std::vector<std::pair<ssize_t, ControlRequest>> requests;
};

TEST(Socket, EveryClientCallSendsItsActionAndParameter)
{
    tarntest::Harness h;  // a fresh root: no log, no socket
    FakeDaemon fake("{\n   \"total\" : 0\n}\n");
    ASSERT_GE(fake.fd, 0);
    char buf[CTRL_REPLY_SIZE];
    struct Expect {
        int rc, action;
        const char *param;  // null: not checked
    };
    const float gains[10] = {0, -3.5f, 10, 1.25f, 0, 0, 0, 0, 0, -12};
    // Braced lists are evaluated in order: the requests arrive in this order.
    const std::vector<Expect> expected = {
        {CtrlPlayPause(), ACT_PLAY_PAUSE, nullptr}, {CtrlStop(), ACT_STOP, nullptr},
        {CtrlNext(), ACT_NEXT, nullptr}, {CtrlPrevious(), ACT_PREVIOUS, nullptr},
        {CtrlPlayIndex(3), ACT_PLAY_INDEX, "3"}, {CtrlSeek(-12), ACT_SEEK, "-12"},
        {CtrlMute(), ACT_MUTE, nullptr}, {CtrlSetVolume(77), ACT_SET_VOLUME, "77"},
        {CtrlVolumeUp(), ACT_VOLUME_UP, nullptr}, {CtrlVolumeDown(), ACT_VOLUME_DOWN, nullptr},
        {CtrlSourceRandom(), ACT_SOURCE_RANDOM, nullptr}, {CtrlSourceRadio(), ACT_SOURCE_RADIO, nullptr},
        {CtrlSourceIpod(), ACT_SOURCE_IPOD, nullptr}, {CtrlSourcePlaylist(), ACT_SOURCE_PLAYLIST, nullptr},
        {CtrlSourceCustom(4), ACT_SOURCE_CUSTOM, "4"}, {CtrlSaveCustom(2), ACT_SAVE_CUSTOM, "2"},
        {CtrlSourceNext(), ACT_SOURCE_NEXT, nullptr}, {CtrlSourcePrevious(), ACT_SOURCE_PREVIOUS, nullptr},
        {CtrlClearChanged(), ACT_CLEAR_CHANGED, nullptr}, {CtrlSetChanged(), ACT_SET_CHANGED, nullptr},
        {CtrlSetEqualizer(gains), ACT_SET_EQUALIZER, "0.0 -3.5 10.0 1.2 0.0 0.0 0.0 0.0 0.0 -12.0"},
        {InfoSearchServers(), ACT_SEARCH_SERVERS, nullptr}, {InfoSearchRenderers(), ACT_SEARCH_RENDERERS, nullptr},
        {InfoListServers(5, 20, buf, sizeof(buf)), ACT_LIST_SERVERS, "5 20"},
        {InfoListRenderers(0, 7, buf, sizeof(buf)), ACT_LIST_RENDERERS, "0 7"},
        {InfoSelectPlayer(-1), ACT_SELECT_PLAYER, "-1"},
        {InfoGetStatus(buf, sizeof(buf)), ACT_GET_STATUS, nullptr},
        {InfoListQueue(10, 10, buf, sizeof(buf)), ACT_QUEUE_LIST, "10 10"},
    };
    EXPECT_STREQ("{\n   \"total\" : 0\n}\n", buf);
    for (int i = 0; i < 100 && fake.Requests().size() < expected.size(); ++i)
        usleep(10000);
    auto got = fake.Requests();
    ASSERT_EQ(expected.size(), got.size());
    for (size_t i = 0; i < expected.size(); ++i) {
        SCOPED_TRACE(i);
        EXPECT_EQ(0, expected[i].rc);
        EXPECT_EQ(CTRL_REQUEST_SIZE, got[i].first);
        EXPECT_EQ(expected[i].action, got[i].second.action);
        const char *param = got[i].second.parameter;
        EXPECT_STREQ(expected[i].param ? expected[i].param : param, param);
    }
    // Bad reply buffers are refused without connecting.
    ControlRequest req = tarntest::MakeRequest(ACT_STOP);
    EXPECT_EQ(-1, CtrlSendRequest(&req, buf, 0));
    EXPECT_EQ(-1, CtrlSendRequest(&req, nullptr, 16));
    EXPECT_EQ(-1, InfoGetStatus(nullptr, 10));
    EXPECT_EQ(-1, InfoListQueue(0, 10, buf, -1));
    EXPECT_EQ(2, h.CountLog("ctrl:45 Bad parameter"));
    EXPECT_EQ(1, h.CountLog("info:135 Bad parameters"));
    EXPECT_EQ(1, h.CountLog("info:160 Bad parameters"));
    usleep(50000);
    EXPECT_EQ(expected.size(), fake.Requests().size());
}

// Held connections: a silent one is closed at its deadline, while a request
// that arrived in time but was not yet served (the loop was busy) stays to be
// served, and the loop's timer does not spin on it.
TEST(Socket, HeldConnectionsCloseTheSilentAndKeepADeliveredRequest)
{
    tarntest::Harness h;
    std::string path = TarnPath(TARN_CTRL_SOCKET);
    int listenFd = SocketListen(path.c_str(), 8);
    ASSERT_GE(listenFd, 0);
    fcntl(listenFd, F_SETFL, fcntl(listenFd, F_GETFL) | O_NONBLOCK);  // as the daemon sets it
    int error = 0;
    int silent = CtrlConnectAt(path.c_str(), false, &error);
    int sender = CtrlConnectAt(path.c_str(), false, &error);
    ASSERT_GE(silent, 0) << strerror(error);
    ASSERT_GE(sender, 0) << strerror(error);
    ControlConnections conns;
    int accepted = 0;
    for (int i = 0; i < 100 && accepted < 2; ++i, usleep(1000))
        accepted += conns.AcceptAll(listenFd);
    ASSERT_EQ(2, accepted);
    ControlRequest req = tarntest::MakeRequest(ACT_STOP);
    ASSERT_EQ(static_cast<ssize_t>(sizeof(req)), write(sender, &req, sizeof(req)));
    EXPECT_GT(conns.TimeoutMs(), 0);
    usleep(650 * 1000);  // both deadlines pass while nothing is served
    EXPECT_EQ(0, conns.TimeoutMs());
    conns.Service();
    ASSERT_EQ(1u, conns.Count());
    EXPECT_EQ(-1, conns.TimeoutMs()) << "a delivered request needs no timer";
    std::vector<struct pollfd> fds;
    conns.AddPollFds(fds);
    ASSERT_EQ(1u, fds.size());
    ASSERT_EQ(1, poll(fds.data(), fds.size(), 1000));
    conns.TakeReady(fds, 0);
    int fd = conns.NextReadable();
    ASSERT_GE(fd, 0);
    ControlRequest got;
    EXPECT_EQ(static_cast<ssize_t>(sizeof(got)), read(fd, &got, sizeof(got)));
    EXPECT_EQ(ACT_STOP, got.action);
    char reply[CTRL_REPLY_SIZE] = "null\n";
    conns.Reply(fd, reply, sizeof(reply));
    EXPECT_EQ(0u, conns.Count());
    std::string text;
    EXPECT_EQ(static_cast<size_t>(CTRL_REPLY_SIZE), TarnReadUntilClosed(sender, 1000, &text));
    char byte;
    EXPECT_EQ(0, read(silent, &byte, 1)) << "the silent client was closed";
    close(silent);
    close(sender);
    close(listenFd);
}

}  // namespace
