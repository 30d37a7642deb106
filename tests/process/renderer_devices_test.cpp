// The daemon with each real renderer it is known to meet: gmediarender and
// rygel's Playbin renderer (which describes later service versions), both
// playing into a fakesink in the test's network. For each: found when it was
// there before the daemon, the queue played through (a song queued by path
// among them) with the silence between songs printed, a frozen renderer that
// never holds the daemon, Repeat One, and a renderer killed and restarted
// that finds its queue again.
#include <gtest/gtest.h>

#include <signal.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <ctime>
#include <functional>
#include <json/json.h>

#include "platform/media_id.h"
#include "tests/harness/renderers.h"
#include "tests/process/tarnweb_test_util.h"

namespace {

const int kSongSeconds = 4;
const char kUdn[] = "5c0ffee0-7a1b-4c2d-9e3f-a0b1c2d3e4f5";
using Clock = std::chrono::steady_clock;

double Since(Clock::time_point t)
{
    return std::chrono::duration<double>(Clock::now() - t).count();
}

struct Renderer {
    const char *kind;  // "gmediarender" or "rygel"
    const char *name;  // its friendly name
};

class RendererDevices : public ::testing::TestWithParam<Renderer> {
protected:
    void SetUp() override
    {
        if (!tarntest::InPrivateNetns())
            GTEST_SKIP() << "run under scripts/netns-run";
        const char *binary = tarntest::RendererProgram(Kind());
        if (access(binary, X_OK) != 0)
            GTEST_SKIP() << binary << " not installed";
    }
    void TearDown() override
    {
        tarnwebtest::EndChild(h, renderer);
        tarnwebtest::EndChild(h, web);
    }
    std::string Kind() const { return GetParam().kind; }

    pid_t StartRenderer(const std::string &iface)
    {
        return tarntest::StartRenderer(h, Kind(), iface, GetParam().name, kUdn);
    }
    Json::Value Ask(int action, const char *param = nullptr, int timeoutMs = 5000)
    {
        std::string text;
        Json::Value v;
        if (h.Request(action, param, &text, timeoutMs) == 0)
            Json::Reader().parse(text, v);
        return v;
    }
    // The renderer's index in the list, -1 when it is not listed.
    int Index()
    {
        Json::Value list = Ask(ACT_LIST_RENDERERS, "0 0");
        for (const Json::Value &r : list["list"])
            if (r["friendly_name"].asString() == GetParam().name)
                return r["index"].asInt();
        return -1;
    }
    bool Wait(const std::function<bool(const Json::Value &)> &pred, int timeoutMs)
    {
        for (Clock::time_point t0 = Clock::now(); !pred(last = Ask(ACT_GET_STATUS)); usleep(20 * 1000))
            if (Since(t0) * 1000 > timeoutMs)
                return false;
        return true;
    }
    bool On(const Json::Value &s, const std::string &token) const
    {
        return s["TransportState"] == "PLAYING" && s["CurrentURI"].asString().find(token) != std::string::npos;
    }

    tarntest::Harness h;
    pid_t web = 0, renderer = 0;
    std::string iface;
    Json::Value last;
};

#define WAIT(cond, ms) ASSERT_TRUE(Wait([&](const Json::Value &v) { return cond; }, ms)) << last << h.Log()

TEST_P(RendererDevices, FoundAtStartPlaysEverySongNeverHoldsTheDaemonAndKeepsItsQueue)
{
    std::string error;
    std::vector<MediaSong> songs = tarnwebtest::MakeLibrary(h, "/music", kSongSeconds, &error);
    ASSERT_EQ(3u, songs.size()) << error;
    // A song that only its path names (no library id, no USB volume).
    h.WriteFile("/extra/by path.mp3", tarnwebtest::ReadAll(songs[0].path));
    h.WriteFile("/etc/tarninfo.conf", "admin_port=18080\n");
    web = tarnwebtest::StartSongServer(h, {"--access-log", h.Path("/tmp/tarnweb-access.log")});
    ASSERT_GT(web, 0);

    // The renderer is on the network first; the daemon lists it at once. (A
    // first start tells which end of the veth pair the daemon's UPnP takes;
    // the renderer goes on the other, so that its traffic crosses the pair.)
    ASSERT_EQ(0, h.Start()) << h.Error();
    std::string daemonIp = fakedev::ListeningAddress(49152), deviceIp;
    fakedev::PeerInterface(daemonIp, deviceIp, iface);
    ASSERT_EQ(0, h.Stop());
    ASSERT_GT(renderer = StartRenderer(iface), 0);
    sleep(2);
    ASSERT_EQ(0, h.Start()) << h.Error();
    ASSERT_EQ(daemonIp, fakedev::ListeningAddress(49152));
    Clock::time_point started = Clock::now();
    int index = -1;
    while ((index = Index()) < 0 && Since(started) < 20)
        usleep(50 * 1000);
    ASSERT_GE(index, 0) << "not listed within 20 s of the start" << h.Log();
    printf("[ %s ] listed %.2f s after the daemon's start\n", Kind().c_str(), Since(started));
    EXPECT_LT(Since(started), 5.0);

    Ask(ACT_SELECT_PLAYER, std::to_string(index).c_str());
    Ask(ACT_SET_REPEAT_MODE, "1");
    std::vector<std::string> tokens;
    for (int i : {0, 1}) {
        TARN_MEDIA_INFO info;
        MediaSongToInfo(songs[static_cast<size_t>(i)], &info);
        ASSERT_EQ(0, h.QueueAdd(info));
        tokens.push_back(MediaIDEncryption(songs[static_cast<size_t>(i)].id));
    }
    TARN_MEDIA_INFO byPath = tarntest::MakeMediaInfo(h.Path("/extra/by path.mp3"), "By Path", "Nobody",
                                                     static_cast<float>(kSongSeconds));
    ASSERT_EQ(0, h.QueueAdd(byPath));
    tokens.push_back("/ipod/" + MediaPathToken(byPath.path));

    // The queue plays through by itself; the song queued by path too.
    Ask(ACT_PLAY_INDEX, "0");
    WAIT(On(v, tokens[0]), 10000);
    std::vector<double> switches;
    Clock::time_point t = Clock::now();
    for (size_t i = 1; i < tokens.size(); ++i) {
        WAIT(On(v, tokens[i]), (kSongSeconds + 8) * 1000);
        switches.push_back(Since(t));
        t = Clock::now();
    }
    printf("[ %s ] song to song %.2f s and %.2f s (songs of %d s)\n", Kind().c_str(), switches[0], switches[1],
           kSongSeconds);
    // No pause between songs: the song after one the renderer moved on to by
    // itself is handed ahead too (its end not left to the slow check, which
    // costs seconds). The renderer names a song handed ahead up to 2 s
    // before it plays it, so one switch may look short and the next long:
    // their sum is what shows a pause.
    double total = 0;
    for (double s : switches)
        total += s;
    EXPECT_LT(total, switches.size() * kSongSeconds + 1.0) << "a pause between two songs";
    // The access log has its line once the song's download ended.
    WAIT(v["TransportState"] == "STOPPED", (kSongSeconds + 8) * 1000);
    EXPECT_NE(std::string::npos, h.ReadFile("/tmp/tarnweb-access.log").find(tokens[2]))
        << "the renderer never fetched the song queued by path";
    EXPECT_EQ("", last["last_error"].asString());

    // Frozen renderer: play requests and status requests are answered at once.
    kill(renderer, SIGSTOP);
    std::string text;
    EXPECT_EQ(0, h.Request(ACT_PLAY_INDEX, "1", &text, 500));
    for (int i = 0; i < 10; ++i) {
        EXPECT_EQ(0, h.Request(ACT_GET_STATUS, nullptr, &text, 500)) << i;
        usleep(200 * 1000);
    }
    EXPECT_NE(2, h.PublishedSegment()->state) << "PLAYING before the renderer said so";
    kill(renderer, SIGCONT);
    WAIT(On(v, tokens[1]), 10000);

    // Repeat One: the song plays again from its start.
    Ask(ACT_SET_REPEAT_MODE, "2");
    Ask(ACT_PLAY_INDEX, "0");
    WAIT(On(v, tokens[0]), 10000);
    // (the position, as the renderer reports it, starts again)
    WAIT(On(v, tokens[0]) && v["RelTime"].asInt() >= kSongSeconds - 2, (kSongSeconds + 4) * 1000);
    WAIT(On(v, tokens[0]) && v["RelTime"].asInt() <= 1, 8000);
    WAIT(On(v, tokens[0]) && v["RelTime"].asInt() >= 1, 5000);

    // Killed while playing: within a few seconds nothing is shown as playing.
    const PublishedStatusShm *seg = h.PublishedSegment();
    ASSERT_NE(nullptr, seg);
    kill(renderer, SIGKILL);
    h.WaitExit(renderer, 5000);
    renderer = 0;
    Clock::time_point killed = Clock::now();
    while (seg->state == 2 && Since(killed) < 10)
        usleep(50 * 1000);
    printf("[ %s ] published state left PLAYING %.2f s after the kill\n", Kind().c_str(), Since(killed));
    EXPECT_NE(2, seg->state);
    EXPECT_LT(Since(killed), 5.0);
    EXPECT_EQ('\0', seg->title[0]);

    // Back with the same UDN: selected again, its queue is there.
    ASSERT_GT(renderer = StartRenderer(iface), 0);
    Clock::time_point back = Clock::now();
    while ((index = Index()) < 0 && Since(back) < 30) {
        if (static_cast<int>(Since(back) * 1000) % 5000 < 60)
            Ask(ACT_SEARCH_RENDERERS);
        usleep(50 * 1000);
    }
    ASSERT_GE(index, 0) << h.Log();
    Ask(ACT_SELECT_PLAYER, std::to_string(index).c_str());
    Json::Value queue = Ask(ACT_QUEUE_LIST, "0 0");
    EXPECT_EQ(3, queue["total"].asInt()) << queue;
    Ask(ACT_SET_REPEAT_MODE, "1");
    Ask(ACT_PLAY_INDEX, "2");
    WAIT(On(v, tokens[2]), 10000);
    Ask(ACT_STOP);
    EXPECT_EQ(0, h.Stop());
}

INSTANTIATE_TEST_SUITE_P(Both, RendererDevices,
                         ::testing::Values(Renderer{"gmediarender", "Tarn Devices Gmr"},
                                           Renderer{"rygel", "Tarn Devices Rygel"}),
                         [](const ::testing::TestParamInfo<Renderer> &info) { return std::string(info.param.kind); });

}  // namespace
