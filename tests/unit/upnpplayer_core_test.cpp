// The renderer player without a network (every action it sends fails; renderer
// records are put into the controller's list directly) and the song-id tokens.
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
        return c.renderers.back();
    }
    static void RemoveFirst(UpnpController &c) { delete c.renderers[0], c.renderers.erase(c.renderers.begin()); }
};

namespace {

tarntest::Harness g_h;  // private root and log file

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
        g_h.WriteFile("/etc/tarninfo.conf", "admin_port=8080\nnet_card1_address=10.9.8.7\nusb_mount_root=/mnt/usb\n");
        record = UpnpControllerAccess::Add(controller, "uuid:renderer-0");
        ASSERT_EQ(0, controller.SelectRenderer(0));
        player.reset(new UpnpPlayer(&controller, 0));
        g_h.ClearLog();
    }
    // Lets the player take the renderer's transport state, as a poll does.
    void RendererReports(const char *state, const char *volume = "40")
    {
        record->transport_state = state;
        record->volume = volume;
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
            g_h.WriteFile("/etc/tarninfo.conf", c.conf), player->ResolveHost();
        TARN_MEDIA_INFO info = Song(5, c.path);
        ASSERT_EQ(0, player->BuildSongUrl(&info, url)) << c.path;
        EXPECT_EQ(c.url, url);
    }
    EXPECT_EQ(-1, player->BuildSongUrl(nullptr, url));
}

TEST_F(UpnpPlayerTest, TransportStateTextsAndPollAtTheRenderersOwnIndex)
{
    const std::pair<const char *, int> texts[] = {
        {"STOPPED", 1}, {"PLAYING", 2}, {"PAUSED_PLAYBACK", 3}, {"TRANSITIONING", 4},
        {"NO_MEDIA_PRESENT", 0}, {"playing", 0}, {"PLAYING ", 0}, {"", 0}};
    for (auto &t : texts)
        EXPECT_EQ(t.second, UpnpPlayer::StateFromText(t.first)) << t.first;
    RendererReports("PAUSED_PLAYBACK");
    RendererReports("NO_MEDIA_PRESENT");  // unknown text: nothing taken
    EXPECT_EQ(3, player->GetState());
    UpnpControllerAccess::Add(controller, "uuid:other");
    UpnpControllerAccess::RemoveFirst(controller);  // ours leaves; the other is at 0
    controller.Lock();
    EXPECT_EQ(-1, player->Poll());
    controller.Unlock();
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
    Json::Value reply;
    ASSERT_EQ(0, Act(ACT_GET_STATUS, nullptr, &reply));
    int first = reply["RelTime"].asInt();
    EXPECT_TRUE(first == 30 || first == 31) << first;
    sleep(2);
    ASSERT_EQ(0, Act(ACT_GET_STATUS, nullptr, &reply));
    EXPECT_GE(reply["RelTime"].asInt(), first + 1);
    EXPECT_EQ(30, record->rel_time);  // the record itself is not changed
    RendererReports("PAUSED_PLAYBACK");  // paused: the renderer's own figure
    ASSERT_EQ(0, Act(ACT_GET_STATUS, nullptr, &reply));
    EXPECT_EQ(30, reply["RelTime"].asInt());
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
    Act(ACT_PLAY_INDEX, "1");
    EXPECT_TRUE(Logged("Failed to set index [1]"));

    RendererReports("PLAYING");
    EXPECT_EQ(0, Act(ACT_STOP));  // stopped whatever the send gave
    EXPECT_EQ(1, player->GetState());
    EXPECT_EQ("STOPPED", record->transport_state);
}

TEST_F(UpnpPlayerTest, PublishCutsLongTitlesAndALostRendererGivesNothing)
{
    Queue(Song(2, "/music/two.mp3", std::string(300, 'T')));
    RendererReports("PLAYING");
    PublishedStatusShm seg = {};
    ASSERT_EQ(0, player->PublishStatus(&seg));
    EXPECT_EQ(254u, strlen(seg.title));
    EXPECT_STREQ("Artist 2", seg.artist);
    UpnpControllerAccess::RemoveFirst(controller);
    memset(&seg, 0x11, sizeof(seg));
    EXPECT_EQ(-1, player->PublishStatus(&seg));
    EXPECT_EQ(0x11111111, seg.volume);
    Json::Value reply;
    EXPECT_EQ(-1, Act(ACT_GET_STATUS, nullptr, &reply));
    EXPECT_EQ("Failed to get UPnP Renderer Info", reply["error"].asString());
}

TEST(SongToken, RoundTripsEveryIdAndRefusesAlteredTokens)
{
    std::set<std::string> seen;
    for (uint32_t id : {0u, 1u, 255u, 256u, 65535u, 123456789u, 0xFFFFFFFFu}) {
        std::string token = MediaIDEncryption(id);
        ASSERT_EQ(static_cast<size_t>(MEDIA_ID_TOKEN_LEN), token.size());
        EXPECT_TRUE(seen.insert(token).second) << "two ids share token " << token;
        uint32_t back = 0xdeadbeef;
        ASSERT_EQ(0, MediaIDDecryption(token.c_str(), &back));
        EXPECT_EQ(id, back);
    }
    std::string token = MediaIDEncryption(4242);
    std::vector<std::string> bad = {token.substr(1), token + "0", std::string(32, '0'), "zz" + token.substr(2)};
    for (size_t i = 0; i < token.size(); ++i)  // every single digit altered
        bad.push_back(token), bad.back()[i] = token[i] == '0' ? '1' : '0';
    uint32_t id = 0;
    for (const std::string &t : bad)
        EXPECT_EQ(-1, MediaIDDecryption(t.c_str(), &id)) << t;
    EXPECT_EQ(-1, MediaIDDecryption(nullptr, &id));
    // The secret is a private file of the installation.
    struct stat st;
    ASSERT_EQ(0, stat(g_h.Path("/usr/tarn/etc/media_id.key").c_str(), &st));
    EXPECT_EQ(0600, st.st_mode & 0777);
}

}  // namespace
