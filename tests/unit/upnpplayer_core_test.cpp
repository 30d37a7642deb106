// The renderer player without a network: song URLs, state texts, the status
// reply, the poll's bookkeeping, publishing and the action table. The
// controller is not started, so every action it would send fails; the
// renderer records are put into its list directly.
#include <gtest/gtest.h>

#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <fstream>
#include <sstream>
#include <string>

#include "platform/media_id.h"
#include "platform/tarn_env.h"
#include "player/playlist.h"
#include "player/upnpplayer.h"
#include "upnp/upnp.h"

struct UpnpControllerAccess {
    static RENDERER_INFO *Add(UpnpController &c, const std::string &udn)
    {
        RENDERER_INFO *r = new RENDERER_INFO;
        r->udn = udn;
        r->friendly_name = "Test renderer " + udn;
        c.renderers.push_back(r);
        return r;
    }
    static void Remove(UpnpController &c, unsigned index)
    {
        delete c.renderers[index];
        c.renderers.erase(c.renderers.begin() + index);
    }
};

namespace {

class RootEnv : public ::testing::Environment {
public:
    void SetUp() override
    {
        char tmpl[] = "/tmp/tarn_upnpplayer_test.XXXXXX";
        ASSERT_NE(nullptr, mkdtemp(tmpl));
        root = tmpl;
        setenv("TARN_ROOT", root.c_str(), 1);
        setenv("TARN_LOG_FILE", (root + "/log.txt").c_str(), 1);
        mkdir((root + "/etc").c_str(), 0755);
    }
    void TearDown() override
    {
        std::string cmd = "rm -rf '" + root + "'";
        system(cmd.c_str());
    }
    static std::string root;
};
std::string RootEnv::root;
::testing::Environment *const g_env = ::testing::AddGlobalTestEnvironment(new RootEnv);

void WriteConf(const std::string &text)
{
    std::ofstream(RootEnv::root + "/etc/tarninfo.conf") << text;
}

std::string Log()
{
    std::ifstream in(RootEnv::root + "/log.txt");
    std::stringstream ss;
    ss << in.rdbuf();
    return ss.str();
}

void ClearLog()
{
    std::ofstream(RootEnv::root + "/log.txt", std::ios::trunc);
}

TARN_MEDIA_INFO Song(uint32_t id, const std::string &path, const std::string &title = "",
                     const std::string &artist = "")
{
    TARN_MEDIA_INFO info;
    memset(&info, 0, sizeof(info));
    info.id = id;
    snprintf(info.path, sizeof(info.path), "%s", path.c_str());
    snprintf(info.title, sizeof(info.title), "%s", title.c_str());
    snprintf(info.artist, sizeof(info.artist), "%s", artist.c_str());
    info.duration = 185.7f;
    return info;
}

ControlRequest Request(int action, const char *text = nullptr)
{
    ControlRequest req;
    memset(&req, 0, sizeof(req));
    req.action = action;
    if (text)
        snprintf(req.parameter, sizeof(req.parameter), "%s", text);
    return req;
}

ControlRequest AddRequest(const TARN_MEDIA_INFO &info)
{
    ControlRequest req = Request(ACT_QUEUE_ADD);
    memcpy(req.parameter, &info, sizeof(info));
    return req;
}

class UpnpPlayerTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        WriteConf("admin_port=8080\nnet_card1_address=10.9.8.7\nusb_mount_root=/mnt/usb\n");
        record = UpnpControllerAccess::Add(controller, "uuid:renderer-0");
        ASSERT_EQ(0, controller.SelectRenderer(0));
        player.reset(new UpnpPlayer(&controller, 0));
        ClearLog();
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
    UpnpController controller;
    RENDERER_INFO *record = nullptr;
    std::unique_ptr<UpnpPlayer> player;
};

TEST_F(UpnpPlayerTest, SongUrlsForStreamsLibrarySongsAndUnknownTypes)
{
    std::string url;
    TARN_MEDIA_INFO radio = Song(1, "HTTP://Radio.Example:8000/Live?a=1&b=2");
    ASSERT_EQ(0, player->BuildSongUrl(&radio, url));
    EXPECT_EQ("HTTP://Radio.Example:8000/Live?a=1&b=2", url);
    TARN_MEDIA_INFO mixed = Song(1, "hTtP://x/y");
    ASSERT_EQ(0, player->BuildSongUrl(&mixed, url));
    EXPECT_EQ("hTtP://x/y", url);

    TARN_MEDIA_INFO lib = Song(77, "/music/Artist/Album/01 Song.FLAC");
    ASSERT_EQ(0, player->BuildSongUrl(&lib, url));
    const std::string prefix = "http://10.9.8.7:8080/audio/webUI/audiotransfer.cgi/";
    ASSERT_EQ(0u, url.rfind(prefix, 0)) << url;
    std::string rest = url.substr(prefix.size());
    ASSERT_EQ(static_cast<size_t>(MEDIA_ID_TOKEN_LEN) + 5, rest.size()) << rest;
    EXPECT_EQ(".flac", rest.substr(MEDIA_ID_TOKEN_LEN));
    uint32_t id = 0;
    ASSERT_EQ(0, MediaIDDecryption(rest.substr(0, MEDIA_ID_TOKEN_LEN).c_str(), &id));
    EXPECT_EQ(77u, id);

    TARN_MEDIA_INFO unknown = Song(78, "/music/notes.xyz");
    ASSERT_EQ(0, player->BuildSongUrl(&unknown, url));
    EXPECT_EQ(".txt", url.substr(url.size() - 4));

    EXPECT_EQ(-1, player->BuildSongUrl(nullptr, url));
}

TEST_F(UpnpPlayerTest, UsbSongsAreAddressedByTheirPathInUnpaddedHex)
{
    std::string url;
    TARN_MEDIA_INFO usb = Song(5, "/mnt/usb/a.mp3");
    ASSERT_EQ(0, player->BuildSongUrl(&usb, url));
    EXPECT_EQ("http://10.9.8.7:8080/audio/webUI/audiotransfer.cgi/ipod/"
              "2f6d6e742f7573622f612e6d7033.mp3",
              url);
    // A byte below 16 gives a single digit.
    TARN_MEDIA_INFO ctl = Song(5, "/mnt/usb/\x01\x0f.ogg");
    ASSERT_EQ(0, player->BuildSongUrl(&ctl, url));
    EXPECT_EQ("http://10.9.8.7:8080/audio/webUI/audiotransfer.cgi/ipod/"
              "2f6d6e742f7573622f1f2e6f6767.ogg",
              url);

    WriteConf("admin_port=8080\nnet_card1_address=10.9.8.7\nusb_mount_root=/\n");
    TARN_MEDIA_INFO a = Song(6, "/a");
    ASSERT_EQ(0, player->BuildSongUrl(&a, url));
    EXPECT_EQ("http://10.9.8.7:8080/audio/webUI/audiotransfer.cgi/ipod/2f61.txt", url);
}

TEST_F(UpnpPlayerTest, HostWithoutAdminPortIsTheBareAddress)
{
    WriteConf("net_card1_address=10.1.1.1\n");
    EXPECT_EQ(-1, player->ResolveHost());
    std::string url;
    TARN_MEDIA_INFO lib = Song(9, "/music/x.mp3");
    ASSERT_EQ(0, player->BuildSongUrl(&lib, url));
    EXPECT_EQ(0u, url.rfind("http://10.1.1.1/audio/webUI/audiotransfer.cgi/", 0)) << url;

    WriteConf("net_card1_address=10.1.1.1\nadmin_port=81\n");
    EXPECT_EQ(0, player->ResolveHost());
    ASSERT_EQ(0, player->BuildSongUrl(&lib, url));
    EXPECT_EQ(0u, url.rfind("http://10.1.1.1:81/audio/", 0)) << url;
}

TEST(UpnpPlayerState, TransportTextsMapToPlayerStates)
{
    EXPECT_EQ(1, UpnpPlayer::StateFromText("STOPPED"));
    EXPECT_EQ(2, UpnpPlayer::StateFromText("PLAYING"));
    EXPECT_EQ(3, UpnpPlayer::StateFromText("PAUSED_PLAYBACK"));
    EXPECT_EQ(4, UpnpPlayer::StateFromText("TRANSITIONING"));
    EXPECT_EQ(0, UpnpPlayer::StateFromText("NO_MEDIA_PRESENT"));
    EXPECT_EQ(0, UpnpPlayer::StateFromText("playing"));
    EXPECT_EQ(0, UpnpPlayer::StateFromText("PLAYING "));
    EXPECT_EQ(0, UpnpPlayer::StateFromText(""));
}

TEST_F(UpnpPlayerTest, SetStateWritesTheTransportTextIntoTheRecord)
{
    player->SetState(3);
    EXPECT_EQ("PAUSED_PLAYBACK", record->transport_state);
    EXPECT_EQ(3, player->GetState());
    player->SetState(7);
    EXPECT_EQ(7, player->GetState());
    EXPECT_EQ("PAUSED_PLAYBACK", record->transport_state);
    EXPECT_NE(std::string::npos, Log().find("SetState not handled, PlayerState [7]"));
}

TEST_F(UpnpPlayerTest, PollTakesStateVolumeAndMuteAndIgnoresUnknownTexts)
{
    RendererReports("PAUSED_PLAYBACK", "42", "1");
    EXPECT_EQ(3, player->GetState());
    RendererReports("NO_MEDIA_PRESENT", "10", "0");
    EXPECT_EQ(3, player->GetState());  // unknown text: nothing taken

    Json::Value reply;
    ControlRequest status = Request(ACT_GET_STATUS);
    ASSERT_EQ(0, player->HandleAction(&status, reply));
    EXPECT_EQ(42, reply["playerVolume"].asInt());
    EXPECT_TRUE(reply["playerMute"].asBool());
    EXPECT_EQ("Test renderer uuid:renderer-0", reply["RendererFriendlyName"].asString());
}

TEST_F(UpnpPlayerTest, PollDoesNothingWhenTheRendererLeftOrMoved)
{
    record->transport_state = "PLAYING";
    UpnpControllerAccess::Add(controller, "uuid:other");
    // Renderer 0 leaves: ours becomes... nothing; the other one is at 0.
    UpnpControllerAccess::Remove(controller, 0);
    record = nullptr;
    controller.Lock();
    EXPECT_EQ(-1, player->Poll());
    controller.Unlock();
    EXPECT_EQ(0, player->GetState());

    // Ours is back, but at index 1: still nothing until the main loop
    // hands the player its new index.
    RENDERER_INFO *back = UpnpControllerAccess::Add(controller, "uuid:renderer-0");
    back->transport_state = "PLAYING";
    controller.Lock();
    EXPECT_EQ(-1, player->Poll());
    player->SetRendererIndex(1);
    EXPECT_EQ(0, player->Poll());
    controller.Unlock();
    EXPECT_EQ(2, player->GetState());
}

TEST_F(UpnpPlayerTest, StatusRelTimeRunsOnWhilePlaying)
{
    record->rel_time = 30;
    RendererReports("PLAYING");
    Json::Value reply;
    ControlRequest status = Request(ACT_GET_STATUS);
    ASSERT_EQ(0, player->HandleAction(&status, reply));
    int first = reply["RelTime"].asInt();
    EXPECT_GE(first, 30);
    EXPECT_LE(first, 31);
    EXPECT_TRUE(reply.isMember("last_send_get_info"));
    EXPECT_TRUE(reply.isMember("last_check_state"));
    EXPECT_EQ("PLAYING", reply["TransportState"].asString());

    sleep(2);
    reply = Json::Value();
    ASSERT_EQ(0, player->HandleAction(&status, reply));
    EXPECT_GE(reply["RelTime"].asInt(), first + 1);
    EXPECT_EQ(30, record->rel_time);  // the record itself is not changed

    // Paused: the renderer's own figure.
    RendererReports("PAUSED_PLAYBACK");
    reply = Json::Value();
    ASSERT_EQ(0, player->HandleAction(&status, reply));
    EXPECT_EQ(30, reply["RelTime"].asInt());
}

TEST_F(UpnpPlayerTest, EstimateRelTimeBelowOneIsZero)
{
    RendererReports("PLAYING");
    EXPECT_EQ(0, player->EstimateRelTime(0));
    EXPECT_EQ(0, player->EstimateRelTime(-1));
    RendererReports("STOPPED");
    EXPECT_EQ(17, player->EstimateRelTime(17));
}

TEST_F(UpnpPlayerTest, StatusWithoutSelectedRendererReportsAnError)
{
    ASSERT_EQ(-1, controller.SelectRenderer(5));
    UpnpControllerAccess::Remove(controller, 0);
    record = nullptr;
    Json::Value reply;
    ControlRequest status = Request(ACT_GET_STATUS);
    EXPECT_EQ(-1, player->HandleAction(&status, reply));
    EXPECT_EQ("Failed to get UPnP Renderer Info", reply["error"].asString());
}

TEST_F(UpnpPlayerTest, ActionsOutsideThePlayerSetAreRefusedWithTheirCode)
{
    const int refused[] = {0, -3, 1, 3, 14, 15, 16, 17, 18, 28, 29, ACT_CYCLE_REPEAT_MODE,
                           31, ACT_SET_EQUALIZER, 36, 99};
    for (int code : refused) {
        Json::Value reply;
        ControlRequest req = Request(code);
        EXPECT_EQ(-1, player->HandleAction(&req, reply)) << code;
        EXPECT_TRUE(reply.isNull()) << code;
        char expected[64];
        snprintf(expected, sizeof(expected), "upnpplayer:739 Action [%d] not handled", code);
        EXPECT_NE(std::string::npos, Log().find(expected)) << expected;
    }
    Json::Value reply;
    EXPECT_EQ(-1, player->HandleAction(nullptr, reply));
    // The lock is free again after every refusal.
    controller.Lock();
    controller.Unlock();
}

TEST_F(UpnpPlayerTest, QueueActionsReachThePlayersOwnQueue)
{
    Json::Value reply;
    ControlRequest add1 = AddRequest(Song(1, "/music/one.mp3", "One", "Ann"));
    ControlRequest add2 = AddRequest(Song(2, "/music/two.mp3", "Two", "Bob"));
    EXPECT_EQ(0, player->HandleAction(&add1, reply));
    EXPECT_EQ(0, player->HandleAction(&add2, reply));
    ControlRequest mode = Request(ACT_SET_REPEAT_MODE, "3");
    EXPECT_EQ(0, player->HandleAction(&mode, reply));
    ControlRequest setCurrent = Request(ACT_QUEUE_SET_CURRENT, "1");
    EXPECT_EQ(0, player->HandleAction(&setCurrent, reply));
    ASSERT_EQ(2u, player->GetPlaylist()->Count());
    EXPECT_EQ(3, player->GetPlaylist()->GetMode());
    EXPECT_EQ(1u, player->GetPlaylist()->Current());

    reply = Json::Value();
    ControlRequest list = Request(ACT_QUEUE_LIST, "0 10");
    EXPECT_EQ(0, player->HandleAction(&list, reply));
    ASSERT_EQ(2u, reply["uris"].size());
    EXPECT_EQ("Two", reply["uris"][1]["title"].asString());
}

TEST_F(UpnpPlayerTest, PlayingStepsStopAtTheFirstFailureWithItsMessage)
{
    Json::Value reply;
    // Empty queue.
    ControlRequest play = Request(ACT_PLAY_INDEX, "0");
    player->HandleAction(&play, reply);
    EXPECT_NE(std::string::npos, Log().find("Failed to set index [0]"));
    ClearLog();
    ControlRequest pp = Request(ACT_PLAY_PAUSE);
    EXPECT_EQ(0, player->HandleAction(&pp, reply));
    EXPECT_NE(std::string::npos, Log().find("Failed to get current song in playlist."));

    ControlRequest add = AddRequest(Song(11, "/music/eleven.mp3", "Eleven"));
    player->HandleAction(&add, reply);

    // A renderer that is not stopped is stopped first: the stop cannot be
    // sent here.
    record->transport_state = "PLAYING";
    ClearLog();
    EXPECT_EQ(0, player->HandleAction(&play, reply));
    EXPECT_NE(std::string::npos, Log().find("Failed to send upnp stop"));

    // A stopped renderer gets the song's URL straight away.
    record->transport_state = "STOPPED";
    ClearLog();
    EXPECT_EQ(0, player->HandleAction(&play, reply));
    std::string log = Log();
    std::string url = "http://10.9.8.7:8080/audio/webUI/audiotransfer.cgi/" + MediaIDEncryption(11) + ".mp3";
    EXPECT_NE(std::string::npos, log.find("Failed to set current uri [" + url + "]")) << log;
    EXPECT_EQ(std::string::npos, log.find("Failed to send upnp stop"));
    EXPECT_NE(2, player->GetState());

    // Negative indexes count as 0; past the end fails.
    ClearLog();
    ControlRequest negative = Request(ACT_PLAY_INDEX, "-4");
    player->HandleAction(&negative, reply);
    EXPECT_NE(std::string::npos, Log().find("Failed to set current uri"));
    ClearLog();
    ControlRequest past = Request(ACT_PLAY_INDEX, "1");
    player->HandleAction(&past, reply);
    EXPECT_NE(std::string::npos, Log().find("Failed to set index [1]"));

    ClearLog();
    ControlRequest seek = Request(ACT_SEEK, "42");
    EXPECT_EQ(0, player->HandleAction(&seek, reply));
    EXPECT_NE(std::string::npos, Log().find("Failed to seek [42]"));
}

TEST_F(UpnpPlayerTest, StopIsAStoppedPlayerWhateverTheSendGave)
{
    RendererReports("PLAYING");
    Json::Value reply;
    ControlRequest stop = Request(ACT_STOP);
    EXPECT_EQ(0, player->HandleAction(&stop, reply));
    EXPECT_EQ(1, player->GetState());
    EXPECT_EQ("STOPPED", record->transport_state);
}

TEST_F(UpnpPlayerTest, PublishWhileStoppedKeepsOnlyChangedVolumeAndQueueSettings)
{
    PublishedStatusShm seg;
    memset(&seg, 0x5a, sizeof(seg));
    seg.changed = 1;
    Json::Value reply;
    ControlRequest mode = Request(ACT_SET_REPEAT_MODE, "3");
    player->HandleAction(&mode, reply);
    RendererReports("STOPPED", "37");
    ASSERT_EQ(0, player->PublishStatus(&seg));
    EXPECT_EQ(1, seg.changed);
    EXPECT_EQ(37, seg.volume);
    EXPECT_EQ(3, seg.repeatMode);
    EXPECT_EQ(0, seg.shuffle);
    EXPECT_EQ(0, seg.state);
    EXPECT_EQ(0, seg.duration);
    EXPECT_EQ('\0', seg.currentUri[0]);
    EXPECT_EQ('\0', seg.title[0]);
    EXPECT_EQ(-1, player->PublishStatus(nullptr));
}

TEST_F(UpnpPlayerTest, PublishWhilePlayingShowsTheRendererAndTheQueueSong)
{
    Json::Value reply;
    ControlRequest add1 = AddRequest(Song(1, "/music/one.mp3", "One", "Ann"));
    ControlRequest add2 = AddRequest(Song(2, "/music/two.mp3", std::string(300, 'T'), "Bob"));
    player->HandleAction(&add1, reply);
    player->HandleAction(&add2, reply);
    ControlRequest cur = Request(ACT_QUEUE_SET_CURRENT, "1");
    player->HandleAction(&cur, reply);

    record->current_uri = "http://10.9.8.7:8080/audio/webUI/audiotransfer.cgi/x.mp3";
    record->duration = 200;
    record->rel_time = 12;
    RendererReports("PLAYING", "55");
    PublishedStatusShm seg;
    memset(&seg, 0, sizeof(seg));
    seg.changed = 1;
    ASSERT_EQ(0, player->PublishStatus(&seg));
    EXPECT_STREQ(record->current_uri.c_str(), seg.currentUri);
    EXPECT_EQ(200, seg.duration);
    EXPECT_EQ(12, seg.position);
    EXPECT_EQ(55, seg.volume);
    EXPECT_EQ(2, seg.state);
    EXPECT_EQ(1, seg.index);
    EXPECT_EQ(254u, strlen(seg.title));
    EXPECT_STREQ("Bob", seg.artist);
    EXPECT_EQ(1, seg.changed);
    EXPECT_EQ(1, seg.repeatMode);

    // Gone from the list: nothing is written.
    UpnpControllerAccess::Remove(controller, 0);
    record = nullptr;
    memset(&seg, 0x11, sizeof(seg));
    EXPECT_EQ(-1, player->PublishStatus(&seg));
    EXPECT_EQ(0x11111111, seg.volume);
}

TEST(UpnpPlayerCreation, UnknownRendererIndexLeavesAPlayerThatDoesNothing)
{
    WriteConf("admin_port=8080\nnet_card1_address=10.9.8.7\n");
    ClearLog();
    UpnpController controller;
    UpnpPlayer player(&controller, 3);
    EXPECT_NE(std::string::npos, Log().find("fatal error, cannot get renderer info."));
    EXPECT_EQ("", player.GetUdn());
    controller.Lock();
    EXPECT_EQ(-1, player.Poll());
    controller.Unlock();
}

}  // namespace
