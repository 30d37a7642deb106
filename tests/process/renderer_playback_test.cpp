// The daemon driving a real UPnP renderer (gmediarender into a fakesink) in
// the test's network, songs fetched from the song server, in one flow.
#include <gtest/gtest.h>

#include <ctime>
#include <functional>
#include <json/json.h>

#include "platform/media_id.h"
#include "tests/process/tarnweb_test_util.h"

namespace {

const int kSongSeconds = 10;
const char kRendererName[] = "Tarn Test Renderer";

struct Flow {
    tarntest::Harness h;
    pid_t web = 0, renderer = 0;
    std::vector<MediaSong> songs;
    Json::Value last;  // the last status reply seen
    ~Flow() { tarnwebtest::EndChild(h, renderer), tarnwebtest::EndChild(h, web); }
    Json::Value Ask(int action, const char *param = nullptr)
    {
        std::string text;
        Json::Value v;
        if (h.Request(action, param, &text, 5000) == 0)
            Json::Reader().parse(text, v);
        return v;
    }
    // Polls the status reply until pred holds.
    bool Wait(const std::function<bool(const Json::Value &)> &pred, int timeoutMs)
    {
        for (time_t end = time(nullptr) + timeoutMs / 1000; !pred(last = Ask(ACT_GET_STATUS)); usleep(250 * 1000))
            if (time(nullptr) >= end)
                return false;
        return true;
    }
    bool IsSong(const Json::Value &s, int i) { return s["CurrentURI"].asString().find(Token(i)) != std::string::npos; }
    std::string Token(int i) { return MediaIDEncryption(songs[i].id); }
    // Requests for song i in the song server's access log.
    int Fetches(int i)
    {
        std::string log = h.ReadFile("/tmp/tarnweb-access.log");
        int n = 0;
        for (size_t pos = 0; (pos = log.find(Token(i), pos)) != std::string::npos; ++pos)
            ++n;
        return n;
    }
};

#define WAIT(cond, ms) ASSERT_TRUE(f.Wait([&](const Json::Value &v) { return cond; }, ms)) << f.last
#define PLAYING(i) (f.IsSong(v, i) && v["TransportState"] == "PLAYING")

TEST(RendererPlayback, QueueTransportVolumeStatusRepeatOneAndLossOfTheRenderer)
{
    ASSERT_TRUE(tarntest::InPrivateNetns()) << "run under scripts/netns-run";
    Flow f;
    std::string error;
    f.songs = tarnwebtest::MakeLibrary(f.h, "/music", kSongSeconds, &error);
    ASSERT_EQ(3u, f.songs.size()) << error;  // mp3, flac, ogg
    f.h.WriteFile("/etc/tarninfo.conf", "admin_port=18080\nnet_card1_ifname=tveth0\n");
    f.web = tarnwebtest::StartSongServer(f.h, {"--access-log", f.h.Path("/tmp/tarnweb-access.log")});
    ASSERT_GT(f.web, 0) << "tarnweb did not start";
    ASSERT_EQ(0, f.h.Start()) << f.h.Error();
    // The renderer starts after the daemon, on the veth end that the daemon's
    // libupnp did not take, so that its announcements cross the pair.
    std::string deviceIp, deviceIface;
    fakedev::PeerInterface(fakedev::ListeningAddress(49152), deviceIp, deviceIface);
    f.renderer = f.h.Spawn({"/usr/bin/gmediarender", "-I", deviceIface, "-p", "49494", "-f", kRendererName,
                            "-u", "3f2c9a10-5b7e-4d21-8c4a-6e1f0b9d2a77", "--gstout-audiopipe",
                            "fakesink sync=true", "--logfile", f.h.Path("/tmp/gmediarender.log")});
    ASSERT_GT(f.renderer, 0);
    int index = -1;
    for (time_t end = time(nullptr) + 120, search = end - 110; index < 0 && time(nullptr) < end; usleep(500 * 1000)) {
        Json::Value list = f.Ask(ACT_LIST_RENDERERS, "0 0");
        for (const Json::Value &r : list["list"])
            if (r["friendly_name"].asString() == kRendererName)
                index = r["index"].asInt();
        if (time(nullptr) > search && (search = time(nullptr) + 10))
            f.Ask(ACT_SEARCH_RENDERERS);
    }
    ASSERT_GE(index, 0) << "the renderer was not discovered within 120 s";
    f.Ask(ACT_SELECT_PLAYER, std::to_string(index).c_str());
    f.Ask(ACT_SET_REPEAT_MODE, "1");
    for (const MediaSong &s : f.songs) {
        TARN_MEDIA_INFO info;
        MediaSongToInfo(s, &info);
        ASSERT_EQ(0, f.h.QueueAdd(info));
    }

    // Song 0 (the mp3, whose length the renderer knows exactly): status and segment.
    time_t start = time(nullptr);
    f.Ask(ACT_PLAY_INDEX, "0");
    WAIT(PLAYING(0) && std::abs(v["Duration"].asInt() - kSongSeconds) <= 1, 20000);
    EXPECT_EQ(kRendererName, f.last["RendererFriendlyName"].asString());
    EXPECT_EQ(index, f.last["RendererIndex"].asInt());
    EXPECT_GE(f.Fetches(0), 1) << "the renderer never asked the song server for song 0";
    EXPECT_EQ(0, f.Fetches(1));
    const PublishedStatusShm *seg = f.h.PublishedSegment();
    ASSERT_NE(nullptr, seg);
    WAIT(seg->state == 2, 5000);
    EXPECT_EQ(0, seg->index);
    EXPECT_NE(nullptr, strstr(seg->currentUri, f.Token(0).c_str()));
    EXPECT_EQ(f.songs[0].title + "/" + f.songs[0].artist, std::string(seg->title) + "/" + seg->artist);
    EXPECT_NEAR(kSongSeconds, seg->duration, 1);
    EXPECT_EQ(1, seg->repeatMode);

    // Volume (clamped; steps from the last reported one) and mute toggles.
    const struct {
        int action;
        const char *param, *volume, *mute;
    } steps[] = {{ACT_SET_VOLUME, "50", "50", "0"}, {ACT_SET_VOLUME, "150", "100", "0"},
                 {ACT_SET_VOLUME, "30", "30", "0"}, {ACT_VOLUME_DOWN, nullptr, "27", "0"},
                 {ACT_VOLUME_UP, nullptr, "30", "0"}, {ACT_MUTE, nullptr, "30", "1"},
                 {ACT_MUTE, nullptr, "30", "0"}};
    for (auto &st : steps) {
        f.Ask(st.action, st.param);
        WAIT(v["Volume"] == st.volume && v["playerVolume"].asInt() == atoi(st.volume) &&
             v["Mute"] == st.mute && v["playerMute"].asBool() == (*st.mute == '1'), 5000);
    }

    // The queue moves on by itself at the end of song 0; song 1 is paused,
    // resumed and sought.
    // (A renderer may name the next song a moment before the end: the
    // position tells that song 1 itself plays.)
    WAIT(PLAYING(1) && v["RelTime"].asInt() >= 2 && v["RelTime"].asInt() <= 6, (kSongSeconds + 20) * 1000);
    EXPECT_GE(time(nullptr) - start, kSongSeconds - 2) << "advanced before the song ended";
    EXPECT_GE(f.Fetches(1), 1);
    f.Ask(ACT_PLAY_PAUSE);
    WAIT(v["TransportState"] == "PAUSED_PLAYBACK", 5000);
    sleep(1);
    int pausedAt = f.Ask(ACT_GET_STATUS)["RelTime"].asInt();
    sleep(2);
    WAIT(v["TransportState"] == "PAUSED_PLAYBACK" && v["RelTime"].asInt() == pausedAt, 0);
    f.Ask(ACT_PLAY_PAUSE);
    WAIT(v["TransportState"] == "PLAYING" && v["RelTime"].asInt() >= pausedAt + 1, 10000);
    f.Ask(ACT_SEEK, "1");
    WAIT(f.IsSong(v, 1) && v["RelTime"].asInt() >= 1 && v["RelTime"].asInt() <= 3, 5000);

    // After the last song: stopped, and it stays that way.
    WAIT(PLAYING(2), (kSongSeconds + 20) * 1000);
    EXPECT_GE(f.Fetches(2), 1);
    WAIT(v["TransportState"] == "STOPPED", (kSongSeconds + 20) * 1000);
    sleep(3);
    WAIT(v["TransportState"] == "STOPPED" && f.IsSong(v, 2), 0);
    EXPECT_TRUE(seg->state == 0 && seg->currentUri[0] == '\0') << seg->currentUri;

    // "Repeat One": at the end the same song plays again from its start.
    f.Ask(ACT_SET_REPEAT_MODE, "2");
    int fetches0 = f.Fetches(0), fetches1 = f.Fetches(1);
    f.Ask(ACT_PLAY_INDEX, "0");
    WAIT(PLAYING(0) && v["RelTime"].asInt() >= kSongSeconds - 3, (kSongSeconds + 15) * 1000);
    WAIT(PLAYING(0) && v["RelTime"].asInt() <= 4 && v["RelTime"].asInt() >= 1, 30000);
    // (the song server writes its log line when a transfer ends)
    for (time_t end = time(nullptr) + kSongSeconds + 2; f.Fetches(0) <= fetches0 + 1 && time(nullptr) < end;)
        usleep(250 * 1000);
    EXPECT_GT(f.Fetches(0), fetches0 + 1) << "the replay did not fetch the song again";
    EXPECT_EQ(fetches1, f.Fetches(1));
    // First only "play again"; this renderer forgets its song and refuses, then the song is given again.
    std::string log = f.h.ReadFile("/tmp/gmediarender.log");
    size_t eos = log.rfind("End-of-stream"), no = std::string::npos;
    size_t refused = log.find("Playing failed", eos), reload = log.find("AVTransportURI: http", eos);
    EXPECT_TRUE(eos != no && reload != no && (refused == no || refused < reload)) << log.substr(eos == no ? 0 : eos);
    // A stop by the user is not the end of a song: nothing advances.
    f.Ask(ACT_STOP);
    WAIT(v["TransportState"] == "STOPPED", 5000);
    sleep(3);
    WAIT(v["TransportState"] == "STOPPED" && f.IsSong(v, 0), 0);

    // Gone without a word: the player goes and the changed flag is set.
    f.Ask(ACT_CLEAR_CHANGED);
    kill(f.renderer, SIGKILL);
    Json::Value list = f.Ask(ACT_LIST_RENDERERS, "0 0");
    for (time_t end = time(nullptr) + 20; time(nullptr) < end && list["total"].asUInt() != 0;)
        usleep(250 * 1000), list = f.Ask(ACT_LIST_RENDERERS, "0 0");
    EXPECT_EQ(0u, list["total"].asUInt()) << list;
    WAIT(seg->changed == 1, 5000);
    std::string text;
    ASSERT_EQ(0, f.h.Request(ACT_GET_STATUS, nullptr, &text));
    EXPECT_EQ("null\n", text);  // no player left
    EXPECT_EQ(0, f.h.Request(ACT_LIST_SERVERS, "0 0", &text));
}

}  // namespace
