// The daemon driving a real UPnP renderer (gmediarender, audio into a
// fakesink) in the test's private network: songs fetched from the song
// server, the queue advancing at each end, pause/resume/seek/volume/mute,
// "Repeat One", the status reply, the published segment and the loss of the
// renderer.
//
// The tests of this program share one set of processes and run in order;
// finding the renderer alone can take a minute.
#include <gtest/gtest.h>

#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <fstream>
#include <functional>
#include <json/json.h>
#include <sstream>
#include <thread>

#include "platform/media_id.h"
#include "platform/medialib.h"
#include "tests/harness/harness.h"
#include "tests/process/tarnweb_test_util.h"
#include "tests/tools/fakedevice/fake_device.h"

namespace {

const int kWebPort = 18080;
const int kSongSeconds = 12;
const char kRendererName[] = "Tarn Test Renderer";
const char kRendererUuid[] = "3f2c9a10-5b7e-4d21-8c4a-6e1f0b9d2a77";

long NowMs()
{
    return std::chrono::duration_cast<std::chrono::milliseconds>(
               std::chrono::steady_clock::now().time_since_epoch())
        .count();
}

struct Shared {
    std::unique_ptr<tarntest::Harness> h;
    std::unique_ptr<tarnwebtest::SongServerProcess> web;
    pid_t renderer = 0;
    int rendererIndex = -1;
    std::vector<MediaSong> songs;
    std::string setupError;
};
Shared *g = nullptr;

Json::Value Ask(int action, const char *param = nullptr)
{
    std::string text;
    Json::Value v;
    if (g->h->Request(action, param, &text, 5000) != 0)
        return v;
    Json::Reader().parse(text, v);
    return v;
}

Json::Value Status()
{
    return Ask(ACT_GET_STATUS);
}

// Polls the status reply until pred holds; false after timeoutMs.
bool WaitStatus(const std::function<bool(const Json::Value &)> &pred, int timeoutMs,
                Json::Value *last = nullptr)
{
    long end = NowMs() + timeoutMs;
    Json::Value s;
    for (;;) {
        s = Status();
        if (pred(s))
            break;
        if (NowMs() >= end) {
            if (last)
                *last = s;
            return false;
        }
        usleep(250 * 1000);
    }
    if (last)
        *last = s;
    return true;
}

std::string SongToken(int i)
{
    return MediaIDEncryption(g->songs[i].id);
}

bool IsSong(const Json::Value &s, int i)
{
    return s["CurrentURI"].asString().find(SongToken(i)) != std::string::npos;
}

// Lines of the song server's access log that ask for song i.
int Fetches(int i)
{
    std::string log = g->h->ReadFile("/tmp/tarnweb-access.log");
    int n = 0;
    for (size_t pos = 0; (pos = log.find(SongToken(i), pos)) != std::string::npos; ++pos)
        ++n;
    return n;
}

// The renderer's own log, without its list of supported types.
std::string RendererLog()
{
    std::istringstream in(g->h->ReadFile("/tmp/gmediarender.log"));
    std::string line, out;
    while (std::getline(in, line))
        if (line.find("Registering support") == std::string::npos)
            out += line + "\n";
    return out;
}

void QueueSongs()
{
    Ask(ACT_QUEUE_CLEAR);
    Ask(ACT_SET_REPEAT_MODE, "1");
    for (const MediaSong &s : g->songs) {
        TARN_MEDIA_INFO info;
        MediaSongToInfo(s, &info);
        ASSERT_EQ(0, g->h->QueueAdd(info));
    }
}

class RendererPlayback : public ::testing::Test {
protected:
    static void SetUpTestSuite()
    {
        g = new Shared;
        if (!tarntest::InPrivateNetns()) {
            g->setupError = "run under scripts/netns-run";
            return;
        }
        g->h.reset(new tarntest::Harness);
        tarntest::Harness &h = *g->h;
        std::string error;
        g->songs = tarnwebtest::MakeLibrary(h, "/music", kSongSeconds, &error);
        if (g->songs.size() != 3) {
            g->setupError = "library: " + error;
            return;
        }
        h.WriteFile("/etc/tarninfo.conf", "admin_port=18080\nnet_card1_ifname=tveth0\n");
        g->web.reset(new tarnwebtest::SongServerProcess(h));
        if (!g->web->Start({"--access-log", h.Path("/tmp/tarnweb-access.log")}, "10.77.0.1",
                           kWebPort)) {
            g->setupError = "tarnweb did not start";
            return;
        }
        if (h.Start() != 0) {
            g->setupError = "tarnaudiod: " + h.Error();
            return;
        }
        // The renderer starts after the daemon: its first announcements are
        // what the daemon hears. It goes on the veth end that the daemon's
        // libupnp did not take (its HTTP server shows which), so that the
        // multicast crosses the pair.
        std::string daemonIp = fakedev::ListeningAddress(49152);
        std::string deviceIp, deviceIface;
        fakedev::PeerInterface(daemonIp, deviceIp, deviceIface);
        fprintf(stderr, "daemon's UPnP address %s, renderer on %s\n", daemonIp.c_str(),
                deviceIface.c_str());
        g->renderer = h.Spawn({"/usr/bin/gmediarender", "-I", deviceIface, "-p", "49494", "-f",
                               kRendererName, "-u", kRendererUuid, "--gstout-audiopipe",
                               "fakesink sync=true", "--logfile", h.Path("/tmp/gmediarender.log")});
        if (g->renderer <= 0) {
            g->setupError = "gmediarender did not start";
            return;
        }
        long end = NowMs() + 120000;
        long nextSearch = NowMs() + 10000;
        while (NowMs() < end && g->rendererIndex < 0) {
            Json::Value list = Ask(ACT_LIST_RENDERERS, "0 0");
            for (const Json::Value &r : list["list"]) {
                if (r["friendly_name"].asString() == kRendererName)
                    g->rendererIndex = r["index"].asInt();
            }
            if (NowMs() > nextSearch) {
                Ask(ACT_SEARCH_RENDERERS);
                nextSearch = NowMs() + 10000;
            }
            usleep(500 * 1000);
        }
        if (g->rendererIndex < 0) {
            g->setupError = "the renderer was not discovered within 120 s";
            return;
        }
        fprintf(stderr, "renderer found at index %d\n", g->rendererIndex);
        Ask(ACT_SELECT_PLAYER, std::to_string(g->rendererIndex).c_str());
    }
    static void TearDownTestSuite()
    {
        if (g->renderer > 0) {
            kill(g->renderer, SIGTERM);
            if (g->h->WaitExit(g->renderer, 5000) == -1) {
                kill(g->renderer, SIGKILL);
                g->h->WaitExit(g->renderer, 5000);
            }
        }
        if (g->h && g->h->Pid() > 0)
            g->h->Stop();
        g->web.reset();
        delete g;
        g = nullptr;
    }
    void SetUp() override
    {
        ASSERT_EQ("", g->setupError);
    }
};

TEST_F(RendererPlayback, QueuePlaysThroughFetchingEachSongAndStopsAtTheEnd)
{
    QueueSongs();
    long start = NowMs();
    Ask(ACT_PLAY_INDEX, "0");
    Json::Value s;
    ASSERT_TRUE(WaitStatus([](const Json::Value &v) { return IsSong(v, 0); }, 15000, &s)) << s;
    EXPECT_TRUE(WaitStatus([](const Json::Value &v) { return v["TransportState"] == "PLAYING"; },
                           10000, &s))
        << s;
    EXPECT_GE(Fetches(0), 1) << "the renderer never asked the song server for song 0";
    EXPECT_EQ(0, Fetches(1));

    // The queue moves on by itself when the renderer stops at each end.
    ASSERT_TRUE(WaitStatus([](const Json::Value &v) { return IsSong(v, 1); },
                           (kSongSeconds + 20) * 1000, &s))
        << s;
    EXPECT_GE(NowMs() - start, (kSongSeconds - 2) * 1000L) << "advanced before the song ended";
    EXPECT_TRUE(WaitStatus([](const Json::Value &v) { return v["TransportState"] == "PLAYING"; },
                           10000, &s));
    EXPECT_GE(Fetches(1), 1);
    ASSERT_TRUE(WaitStatus([](const Json::Value &v) { return IsSong(v, 2); },
                           (kSongSeconds + 20) * 1000, &s))
        << s;
    EXPECT_GE(Fetches(2), 1);

    // After the last song: stopped, and it stays that way.
    ASSERT_TRUE(WaitStatus([](const Json::Value &v) { return v["TransportState"] == "STOPPED"; },
                           (kSongSeconds + 20) * 1000, &s))
        << s;
    sleep(8);
    s = Status();
    EXPECT_EQ("STOPPED", s["TransportState"].asString());
    EXPECT_TRUE(IsSong(s, 2)) << s;
    EXPECT_EQ(1, Fetches(0) > 0 && Fetches(0) <= 2 ? 1 : 0) << "song 0 fetched " << Fetches(0);
}

TEST_F(RendererPlayback, PauseResumeSeekVolumeAndMuteReachTheRenderer)
{
    QueueSongs();
    Ask(ACT_PLAY_INDEX, "1");
    Json::Value s;
    ASSERT_TRUE(WaitStatus([](const Json::Value &v) {
        return IsSong(v, 1) && v["TransportState"] == "PLAYING" && v["RelTime"].asInt() >= 2;
    }, 20000, &s)) << s;

    Ask(ACT_PLAY_PAUSE);
    // The renderer's own position stops moving.
    ASSERT_TRUE(WaitStatus([](const Json::Value &v) { return v["TransportState"] == "PAUSED_PLAYBACK"; },
                           5000, &s));
    sleep(3);
    int pausedAt = Status()["RelTime"].asInt();
    sleep(3);
    s = Status();
    EXPECT_EQ("PAUSED_PLAYBACK", s["TransportState"].asString());
    EXPECT_EQ(pausedAt, s["RelTime"].asInt()) << "position moved while paused";

    Ask(ACT_PLAY_PAUSE);
    EXPECT_TRUE(WaitStatus([pausedAt](const Json::Value &v) {
        return v["TransportState"] == "PLAYING" && v["RelTime"].asInt() >= pausedAt + 2;
    }, 10000, &s)) << s;

    // Seek back to 1 s: the renderer's reported position drops.
    Ask(ACT_SEEK, "1");
    EXPECT_TRUE(WaitStatus([](const Json::Value &v) {
        return v["RelTime"].asInt() >= 1 && v["RelTime"].asInt() <= 3;
    }, 5000, &s)) << s;

    // The renderer announces only changes: start from a known volume.
    Ask(ACT_SET_VOLUME, "50");
    EXPECT_TRUE(WaitStatus([](const Json::Value &v) { return v["Volume"] == "50"; }, 5000, &s)) << s;
    Ask(ACT_SET_VOLUME, "150");  // clamped to 100
    EXPECT_TRUE(WaitStatus([](const Json::Value &v) { return v["Volume"] == "100"; }, 5000, &s)) << s;
    Ask(ACT_SET_VOLUME, "30");
    EXPECT_TRUE(WaitStatus([](const Json::Value &v) {
        return v["Volume"] == "30" && v["playerVolume"].asInt() == 30;
    }, 5000, &s)) << s;
    Ask(ACT_VOLUME_DOWN);
    EXPECT_TRUE(WaitStatus([](const Json::Value &v) { return v["Volume"] == "27"; }, 5000, &s)) << s;
    Ask(ACT_VOLUME_UP);
    Ask(ACT_VOLUME_UP);
    // Each step starts from the volume the renderer last reported.
    EXPECT_TRUE(WaitStatus([](const Json::Value &v) {
        int vol = atoi(v["Volume"].asCString());
        return vol == 30 || vol == 33;
    }, 5000, &s)) << s;

    std::string muteBefore = Status()["Mute"].asString();
    Ask(ACT_MUTE);
    EXPECT_TRUE(WaitStatus([](const Json::Value &v) {
        return v["Mute"] == "1" && v["playerMute"].asBool();
    }, 5000, &s)) << s << " (before: " << muteBefore << ")";
    Ask(ACT_MUTE);
    EXPECT_TRUE(WaitStatus([](const Json::Value &v) { return v["Mute"] == "0"; }, 5000, &s)) << s;

    Ask(ACT_STOP);
    EXPECT_TRUE(WaitStatus([](const Json::Value &v) { return v["TransportState"] == "STOPPED"; },
                           5000, &s));
    // A stop by the user is not the end of a song: nothing advances.
    sleep(8);
    s = Status();
    EXPECT_EQ("STOPPED", s["TransportState"].asString());
    EXPECT_TRUE(IsSong(s, 1)) << s;
}

TEST_F(RendererPlayback, RepeatOneReplaysTheSameSongWithoutLoadingAnother)
{
    QueueSongs();
    Ask(ACT_SET_REPEAT_MODE, "2");
    int fetches0 = Fetches(0), fetches1 = Fetches(1);
    Ask(ACT_PLAY_INDEX, "0");
    Json::Value s;
    ASSERT_TRUE(WaitStatus([](const Json::Value &v) {
        return IsSong(v, 0) && v["TransportState"] == "PLAYING";
    }, 15000, &s)) << s;
    // Wait for the end and the replay: the position restarts from the beginning.
    ASSERT_TRUE(WaitStatus([](const Json::Value &v) { return v["RelTime"].asInt() >= kSongSeconds - 3; },
                           (kSongSeconds + 5) * 1000, &s)) << s;
    ASSERT_TRUE(WaitStatus([](const Json::Value &v) {
        return v["TransportState"] == "PLAYING" && v["RelTime"].asInt() <= 4 && v["RelTime"].asInt() >= 1;
    }, 30000, &s)) << s << RendererLog();
    EXPECT_TRUE(IsSong(s, 0)) << s;
    EXPECT_GT(Fetches(0), fetches0 + 1) << "the replay did not fetch the song again";
    EXPECT_EQ(fetches1, Fetches(1));

    // At the end the renderer was first told only to play again. This
    // renderer forgets its song at the end and refuses that; only then is
    // the song given to it again.
    std::string log = RendererLog();
    size_t end = log.rfind("End-of-stream");
    ASSERT_NE(std::string::npos, end) << log;
    size_t refused = log.find("Playing failed", end);
    size_t reload = log.find("AVTransportURI: http", end);
    ASSERT_NE(std::string::npos, reload) << log;
    if (refused != std::string::npos) {
        EXPECT_LT(refused, reload) << log;
    }
    Ask(ACT_STOP);
}

TEST_F(RendererPlayback, StatusReplyAndPublishedSegmentFollowTheRenderer)
{
    QueueSongs();
    // The mp3: the renderer reports its length exactly (it estimates the
    // Ogg song's from its first pages).
    Ask(ACT_PLAY_INDEX, "0");
    Json::Value s;
    ASSERT_TRUE(WaitStatus([](const Json::Value &v) {
        return IsSong(v, 0) && v["TransportState"] == "PLAYING" &&
               std::abs(v["Duration"].asInt() - kSongSeconds) <= 1;
    }, 20000, &s)) << s;
    EXPECT_EQ(kRendererName, s["RendererFriendlyName"].asString());
    EXPECT_EQ(g->rendererIndex, s["RendererIndex"].asInt());
    EXPECT_TRUE(s.isMember("last_send_get_info"));
    EXPECT_TRUE(s.isMember("last_check_state"));

    const PublishedStatusShm *seg = g->h->PublishedSegment();
    ASSERT_NE(nullptr, seg);
    long end = NowMs() + 5000;
    while (NowMs() < end && seg->state != 2)
        usleep(100 * 1000);
    EXPECT_EQ(2, seg->state);
    EXPECT_EQ(0, seg->index);
    EXPECT_NE(nullptr, strstr(seg->currentUri, SongToken(0).c_str())) << seg->currentUri;
    EXPECT_STREQ(g->songs[0].title.c_str(), seg->title);
    EXPECT_STREQ(g->songs[0].artist.c_str(), seg->artist);
    EXPECT_NEAR(kSongSeconds, seg->duration, 1);
    EXPECT_EQ(1, seg->repeatMode);

    Ask(ACT_STOP);
    end = NowMs() + 5000;
    while (NowMs() < end && seg->state != 0)
        usleep(100 * 1000);
    EXPECT_EQ(0, seg->state);
    EXPECT_EQ('\0', seg->currentUri[0]);
    EXPECT_EQ(1, seg->repeatMode);
}

TEST_F(RendererPlayback, LosingTheRendererRemovesItsPlayerAndSetsTheChangedFlag)
{
    Ask(ACT_CLEAR_CHANGED);
    const PublishedStatusShm *seg = g->h->PublishedSegment();
    ASSERT_NE(nullptr, seg);
    // Gone without a word: the next position request cannot connect.
    kill(g->renderer, SIGKILL);
    g->h->WaitExit(g->renderer, 5000);
    g->renderer = 0;
    Json::Value list;
    long end = NowMs() + 20000;
    do {
        usleep(250 * 1000);
        list = Ask(ACT_LIST_RENDERERS, "0 0");
    } while (NowMs() < end && list["total"].asUInt() != 0);
    EXPECT_EQ(0u, list["total"].asUInt()) << list;
    end = NowMs() + 5000;
    while (NowMs() < end && seg->changed != 1)
        usleep(100 * 1000);
    EXPECT_EQ(1, seg->changed);
    // With no player left, player requests go nowhere.
    std::string text;
    ASSERT_EQ(0, g->h->Request(ACT_GET_STATUS, nullptr, &text));
    EXPECT_EQ("null\n", text);
    // The daemon keeps running and answers.
    EXPECT_EQ(0, g->h->Request(ACT_LIST_SERVERS, "0 0", &text));
}

}  // namespace
