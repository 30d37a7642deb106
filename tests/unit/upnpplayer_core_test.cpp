// The renderer player without a network, and the song-id tokens. The
// controller is not started, so every action it would send fails; renderer
// records are put into its list directly.
#include <gtest/gtest.h>

#include <sys/stat.h>
#include <unistd.h>

#include <cstring>
#include <set>

#include "platform/media_id.h"
#include "player/upnpplayer.h"
#include "tests/harness/harness.h"
#include "upnp/upnp.h"

struct UpnpControllerAccess {
    static RENDERER_INFO *Add(UpnpController &c, const std::string &udn)
    {
        c.renderers.push_back(new RENDERER_INFO);
        c.renderers.back()->udn = udn;
        c.renderers.back()->friendly_name = "Test renderer " + udn;
        return c.renderers.back();
    }
    static void RemoveFirst(UpnpController &c) { delete c.renderers[0], c.renderers.erase(c.renderers.begin()); }
};

namespace {

tarntest::Harness g_h;  // private root and log file

void WriteConf(const std::string &text) { g_h.WriteFile("/etc/tarninfo.conf", text); }
bool Logged(const std::string &text) { return g_h.CountLog(text) > 0; }

TARN_MEDIA_INFO Song(uint32_t id, const std::string &path, const std::string &title = "")
{
    TARN_MEDIA_INFO info = tarntest::MakeMediaInfo(path, title, "Artist " + std::to_string(id));
    info.id = id;
    return info;
}

class UpnpPlayerTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        WriteConf("admin_port=8080\nnet_card1_address=10.9.8.7\nusb_mount_root=/mnt/usb\n");
        record = UpnpControllerAccess::Add(controller, "uuid:renderer-0");
        ASSERT_EQ(0, controller.SelectRenderer(0));
        player.reset(new UpnpPlayer(&controller, 0));
        g_h.ClearLog();
    }
    // Lets the player take the renderer's transport state, as a poll does.
    void RendererReports(const char *state, const char *volume = "40", const char *mute = "0")
    {
        record->transport_state = state;
        record->volume = volume;
        record->mute = mute;
        controller.Lock();
        EXPECT_EQ(0, player->Poll());
        controller.Unlock();
    }
    int Act(int action, const char *text = nullptr, Json::Value *reply = nullptr,
            const TARN_MEDIA_INFO *song = nullptr)
    {
        Json::Value scratch;
        ControlRequest req = tarntest::MakeRequest(action, text);
        if (song)
            memcpy(req.parameter, song, sizeof(*song));
        return player->HandleAction(&req, reply ? *reply : scratch);
    }
    void Queue(const TARN_MEDIA_INFO &info) { EXPECT_EQ(0, Act(ACT_QUEUE_ADD, nullptr, nullptr, &info)); }
    UpnpController controller;
    RENDERER_INFO *record = nullptr;
    std::unique_ptr<UpnpPlayer> player;
};

TEST_F(UpnpPlayerTest, SongUrlsForStreamsLibraryAndUsbSongs)
{
    const std::string base = "http://10.9.8.7:8080/audio/webUI/audiotransfer.cgi/";
    const std::string token = MediaIDEncryption(5);
    struct {
        const char *conf, *path;  // conf "" keeps the one before
        std::string url;
    } cases[] = {
        {"", "HTTP://Radio.Example:8000/Live?a=1&b=2", "HTTP://Radio.Example:8000/Live?a=1&b=2"},
        {"", "/mnt/usb/a.mp3", base + "ipod/2f6d6e742f7573622f612e6d7033.mp3"},
        {"", "/mnt/usb/\x01\x0f.ogg", base + "ipod/2f6d6e742f7573622f1f2e6f6767.ogg"},  // unpadded
        {"", "/music/Artist/01 Song.FLAC", base + token + ".flac"},
        {"", "/music/notes.xyz", base + token + ".txt"},
        {"", "/mnt/usb2/a.mp3", base + token + ".mp3"},  // the USB root by whole components
        {"admin_port=8080\nnet_card1_address=10.9.8.7\nusb_mount_root=/\n", "/a", base + "ipod/2f61.txt"},
        {"net_card1_address=10.1.1.1\n", "/m/x.mp3", "http://10.1.1.1/audio/webUI/audiotransfer.cgi/" + token + ".mp3"},
    };
    std::string url;
    for (auto &c : cases) {
        if (*c.conf)
            WriteConf(c.conf), player->ResolveHost();
        TARN_MEDIA_INFO info = Song(5, c.path);
        ASSERT_EQ(0, player->BuildSongUrl(&info, url)) << c.path;
        EXPECT_EQ(c.url, url);
    }
    EXPECT_EQ(-1, player->BuildSongUrl(nullptr, url));
}

TEST_F(UpnpPlayerTest, TransportStatesFromTextsAndPoll)
{
    const std::pair<const char *, int> texts[] = {
        {"STOPPED", 1}, {"PLAYING", 2}, {"PAUSED_PLAYBACK", 3}, {"TRANSITIONING", 4},
        {"NO_MEDIA_PRESENT", 0}, {"playing", 0}, {"PLAYING ", 0}, {"", 0}};
    for (auto &t : texts)
        EXPECT_EQ(t.second, UpnpPlayer::StateFromText(t.first)) << t.first;

    RendererReports("PAUSED_PLAYBACK");
    RendererReports("NO_MEDIA_PRESENT");  // unknown text: nothing taken
    EXPECT_EQ(3, player->GetState());
}

TEST_F(UpnpPlayerTest, PollFollowsTheRendererOnlyAtItsOwnIndex)
{
    UpnpControllerAccess::Add(controller, "uuid:other");
    UpnpControllerAccess::RemoveFirst(controller);  // ours leaves; the other is at 0
    controller.Lock();
    EXPECT_EQ(-1, player->Poll());
    controller.Unlock();
    EXPECT_EQ(0, player->GetState());
    // Back at index 1: nothing until the main loop hands over the new index.
    UpnpControllerAccess::Add(controller, "uuid:renderer-0")->transport_state = "PLAYING";
    controller.Lock();
    EXPECT_EQ(-1, player->Poll());
    player->SetRendererIndex(1);
    EXPECT_EQ(0, player->Poll());
    controller.Unlock();
    EXPECT_EQ(2, player->GetState());
}

TEST_F(UpnpPlayerTest, RelTimeRunsOnWithWallTimeOnlyWhilePlaying)
{
    record->rel_time = 30;
    RendererReports("PLAYING");
    EXPECT_EQ(0, player->EstimateRelTime(0));
    Json::Value reply;
    ASSERT_EQ(0, Act(ACT_GET_STATUS, nullptr, &reply));
    int first = reply["RelTime"].asInt();
    EXPECT_TRUE(first == 30 || first == 31) << first;
    sleep(2);
    ASSERT_EQ(0, Act(ACT_GET_STATUS, nullptr, &reply));
    EXPECT_GE(reply["RelTime"].asInt(), first + 1);
    EXPECT_EQ(30, record->rel_time);  // the record itself is not changed

    RendererReports("PAUSED_PLAYBACK");
    ASSERT_EQ(0, Act(ACT_GET_STATUS, nullptr, &reply));
    EXPECT_EQ(30, reply["RelTime"].asInt());
    EXPECT_EQ(17, player->EstimateRelTime(17));

    UpnpControllerAccess::RemoveFirst(controller);
    reply = Json::Value();
    EXPECT_EQ(-1, Act(ACT_GET_STATUS, nullptr, &reply));
    EXPECT_EQ("Failed to get UPnP Renderer Info", reply["error"].asString());
}

TEST_F(UpnpPlayerTest, ActionsOutsideThePlayerSetAreRefusedWithTheirCode)
{
    for (int code : {0, -3, 1, 14, 18, 29, 30, 31, 35, 36, 99}) {
        Json::Value reply;
        EXPECT_EQ(-1, Act(code, nullptr, &reply)) << code;
        EXPECT_TRUE(reply.isNull()) << code;
        EXPECT_TRUE(Logged("upnpplayer:739 Action [" + std::to_string(code) + "] not handled")) << code;
    }
    Json::Value reply;
    EXPECT_EQ(-1, player->HandleAction(nullptr, reply));
    controller.Lock();  // free again after every refusal
    controller.Unlock();
}

TEST_F(UpnpPlayerTest, QueueAndPlayingStepsStopAtTheFirstFailureWithItsMessage)
{
    EXPECT_EQ(0, Act(ACT_PLAY_PAUSE));
    EXPECT_TRUE(Logged("Failed to get current song in playlist."));
    Queue(Song(11, "/music/eleven.mp3"));
    record->transport_state = "PLAYING";  // not stopped: stopped first, which fails here
    EXPECT_EQ(0, Act(ACT_PLAY_INDEX, "0"));
    EXPECT_TRUE(Logged("Failed to send upnp stop"));
    record->transport_state = "STOPPED";  // stopped: the song's URL straight away
    g_h.ClearLog();
    EXPECT_EQ(0, Act(ACT_PLAY_INDEX, "-4"));  // negative counts as 0
    EXPECT_TRUE(Logged("Failed to set current uri [http://10.9.8.7:8080/audio/webUI/audiotransfer.cgi/" +
                       MediaIDEncryption(11) + ".mp3]"));
    EXPECT_FALSE(Logged("Failed to send upnp stop"));
    EXPECT_NE(2, player->GetState());
    Act(ACT_PLAY_INDEX, "1");
    EXPECT_TRUE(Logged("Failed to set index [1]"));

    RendererReports("PLAYING");
    EXPECT_EQ(0, Act(ACT_STOP));  // stopped whatever the send gave
    EXPECT_EQ(1, player->GetState());
    EXPECT_EQ("STOPPED", record->transport_state);
}

TEST_F(UpnpPlayerTest, PublishCutsLongTitlesAndWritesNothingForALostRenderer)
{
    Queue(Song(2, "/music/two.mp3", std::string(300, 'T')));
    record->current_uri = "http://10.9.8.7:8080/audio/webUI/audiotransfer.cgi/x.mp3";
    record->rel_time = 12;
    RendererReports("PLAYING", "55");
    PublishedStatusShm seg;
    memset(&seg, 0x5a, sizeof(seg));
    ASSERT_EQ(0, player->PublishStatus(&seg));
    EXPECT_STREQ(record->current_uri.c_str(), seg.currentUri);
    EXPECT_EQ(12, seg.position);
    EXPECT_EQ(254u, strlen(seg.title));
    EXPECT_STREQ("Artist 2", seg.artist);
    UpnpControllerAccess::RemoveFirst(controller);
    memset(&seg, 0x11, sizeof(seg));
    EXPECT_EQ(-1, player->PublishStatus(&seg));
    EXPECT_EQ(0x11111111, seg.volume);
}

TEST(SongToken, RoundTripsEveryIdAndRefusesAlteredTokens)
{
    std::set<std::string> seen;
    for (uint32_t id : {0u, 1u, 255u, 256u, 65535u, 123456789u, 0xFFFFFFFFu}) {
        std::string token = MediaIDEncryption(id);
        ASSERT_EQ(static_cast<size_t>(MEDIA_ID_TOKEN_LEN), token.size());
        EXPECT_EQ(std::string::npos, token.find_first_not_of("0123456789abcdef")) << token;
        EXPECT_TRUE(seen.insert(token).second) << "two ids share token " << token;
        uint32_t back = 0xdeadbeef;
        ASSERT_EQ(0, MediaIDDecryption(token.c_str(), &back));
        EXPECT_EQ(id, back);
    }
    std::string token = MediaIDEncryption(4242);
    uint32_t id = 0;
    for (size_t i = 0; i < token.size(); ++i) {
        std::string t = token;
        t[i] = t[i] == '0' ? '1' : '0';
        EXPECT_EQ(-1, MediaIDDecryption(t.c_str(), &id)) << "digit " << i;
    }
    for (const std::string &bad : {token.substr(1), token + "0", std::string(32, '0'),
                                   "zz" + token.substr(2), std::string()})
        EXPECT_EQ(-1, MediaIDDecryption(bad.c_str(), &id)) << bad;
    EXPECT_EQ(-1, MediaIDDecryption(nullptr, &id));
    // The secret is a private file of the installation.
    struct stat st;
    ASSERT_EQ(0, stat(g_h.Path("/usr/tarn/etc/media_id.key").c_str(), &st));
    EXPECT_EQ(0600, st.st_mode & 0777);
    EXPECT_EQ(16, st.st_size);
}

}  // namespace
