// The client calls and the tarnctl tool against the real daemon.
#include <gtest/gtest.h>

#include <cstring>
#include <string>
#include <unistd.h>

#include <json/json.h>

#include "daemon/ctrl.h"
#include "daemon/socket.h"
#include "daemon/tarn_types.h"
#include "tests/harness/harness.h"

namespace {

bool ParseJson(const std::string &text, Json::Value &out)
{
    Json::CharReaderBuilder b;
    std::string errs;
    std::unique_ptr<Json::CharReader> r(b.newCharReader());
    return r->parse(text.data(), text.data() + text.size(), &out, &errs);
}

class ClientsTest : public ::testing::Test {
protected:
    tarntest::Harness h;
    std::string tarnctl = tarntest::BinPath("tarnctl");

    Json::Value Queue()
    {
        char buf[CTRL_REPLY_SIZE];
        Json::Value v;
        if (InfoListQueue(0, 20, buf, sizeof(buf)) == 0)
            ParseJson(buf, v);
        return v;
    }
    int Changed()
    {
        const PublishedStatusShm *pub = h.PublishedSegment();
        return pub ? pub->changed : -1;
    }
};

TEST_F(ClientsTest, EveryClientCallIsAnsweredByTheDaemon)
{
    ASSERT_EQ(0, h.Start()) << h.Error();
    for (int i = 0; i < 3; ++i)
        ASSERT_EQ(0, h.QueueAdd(tarntest::MakeMediaInfo("/nonexistent/song" + std::to_string(i) +
                                                        ".mp3")));
    char buf[CTRL_REPLY_SIZE];
    Json::Value v;

    EXPECT_EQ(0, InfoGetStatus(buf, sizeof(buf)));
    ASSERT_TRUE(ParseJson(buf, v)) << buf;
    EXPECT_TRUE(v.isMember("Volume"));
    EXPECT_EQ(0, InfoListQueue(1, 1, buf, sizeof(buf)));
    ASSERT_TRUE(ParseJson(buf, v)) << buf;
    EXPECT_EQ(3, v["total"].asInt());
    EXPECT_EQ("song1", v["uris"][0]["title"].asString());
    EXPECT_EQ(0, InfoListServers(0, 5, buf, sizeof(buf)));
    ASSERT_TRUE(ParseJson(buf, v)) << buf;
    EXPECT_EQ(5, v["limit"].asInt());
    EXPECT_EQ(0, InfoListRenderers(0, 5, buf, sizeof(buf)));
    ASSERT_TRUE(ParseJson(buf, v)) << buf;
    EXPECT_TRUE(v.isMember("current"));

    EXPECT_EQ(0, CtrlSetChanged());
    usleep(20000);
    EXPECT_EQ(1, Changed());
    EXPECT_EQ(0, CtrlClearChanged());
    usleep(20000);
    EXPECT_EQ(0, Changed());

    EXPECT_EQ(0, CtrlSetVolume(40));
    EXPECT_EQ(0, InfoGetStatus(buf, sizeof(buf)));
    ASSERT_TRUE(ParseJson(buf, v));
    EXPECT_EQ(40, v["Volume"].asInt());
    EXPECT_EQ(0, CtrlVolumeUp());
    EXPECT_EQ(0, CtrlVolumeDown());
    EXPECT_EQ(0, CtrlMute());
    EXPECT_EQ(0, CtrlMute());

    // Player actions answer whether or not a song can be played here.
    EXPECT_EQ(0, CtrlPlayIndex(2));
    EXPECT_EQ(0, CtrlSeek(5));
    EXPECT_EQ(0, CtrlNext());
    EXPECT_EQ(0, CtrlPrevious());
    EXPECT_EQ(0, CtrlPlayPause());
    EXPECT_EQ(0, CtrlStop());
    const float gains[10] = {0, 1, 2, 3, 4, 5, 6, 7, 8, 9};
    EXPECT_EQ(0, CtrlSetEqualizer(gains));

    EXPECT_EQ(0, InfoSearchServers());
    EXPECT_EQ(0, InfoSearchRenderers());
    EXPECT_EQ(0, InfoSelectPlayer(-1));

    // Source changes answer too (they fail without a media library).
    EXPECT_EQ(0, CtrlSourceRandom());
    EXPECT_EQ(0, CtrlSourceRadio());
    EXPECT_EQ(0, CtrlSourceIpod());
    EXPECT_EQ(0, CtrlSourcePlaylist());
    EXPECT_EQ(0, CtrlSourceCustom(1));
    EXPECT_EQ(0, CtrlSourceNext());
    EXPECT_EQ(0, CtrlSourcePrevious());
    EXPECT_EQ(0, CtrlSaveCustom(1));

    EXPECT_EQ(0, InfoGetStatus(buf, sizeof(buf)));
    EXPECT_EQ(0, h.Stop());
    // With the daemon gone the calls fail.
    EXPECT_EQ(-1, CtrlStop());
    EXPECT_EQ(-1, InfoGetStatus(buf, sizeof(buf)));
}

TEST_F(ClientsTest, TarnctlWithoutDaemonSaysHowToStartIt)
{
    std::string out;
    EXPECT_EQ(1, h.Run({tarnctl, "status"}, &out));
    EXPECT_NE(std::string::npos, out.find("tarnaudiod is not running")) << out;
    EXPECT_NE(std::string::npos, out.find("scripts/run.sh")) << out;
    EXPECT_EQ(1, h.Run({tarnctl, "watch", "--count", "1"}, &out));
    EXPECT_EQ(2, h.Run({tarnctl, "frobnicate"}, &out));
    EXPECT_NE(std::string::npos, out.find("usage:")) << out;
}

TEST_F(ClientsTest, TarnctlReportsADaemonThatDoesNotAnswer)
{
    // Something listens on the control socket but never serves it.
    int fd = SocketListen(h.Path(TARN_CTRL_SOCKET).c_str(), 5);
    ASSERT_GE(fd, 0);
    std::string out;
    EXPECT_EQ(1, h.Run({tarnctl, "--timeout", "300", "status"}, &out));
    EXPECT_NE(std::string::npos, out.find("did not answer within 300 ms")) << out;
    close(fd);
}

TEST_F(ClientsTest, TarnctlDrivesTheQueueAndShowsStatus)
{
    ASSERT_EQ(0, h.Start()) << h.Error();
    std::string out;
    ASSERT_EQ(0, h.Run({tarnctl, "add", "/music/First Song.mp3", "/music/second.flac"}, &out)) << out;
    ASSERT_EQ(0, h.Run({tarnctl, "queue", "insert", "1", "/music/middle.ogg"}, &out)) << out;
    // More songs than one page, so the listing has to join pages.
    for (int i = 0; i < 12; ++i)
        ASSERT_EQ(0, h.QueueAdd(tarntest::MakeMediaInfo("/music/extra" + std::to_string(i) + ".mp3")));
    ASSERT_EQ(0, h.Run({tarnctl, "queue", "--page", "4"}, &out)) << out;
    EXPECT_NE(std::string::npos, out.find("15 songs")) << out;
    EXPECT_NE(std::string::npos, out.find("First Song")) << out;
    EXPECT_NE(std::string::npos, out.find("middle")) << out;
    EXPECT_NE(std::string::npos, out.find("extra11")) << out;
    EXPECT_LT(out.find("middle"), out.find("second")) << out;

    ASSERT_EQ(0, h.Run({tarnctl, "--json", "queue"}, &out)) << out;
    Json::Value v;
    ASSERT_TRUE(ParseJson(out, v)) << out;
    EXPECT_EQ(15u, v["uris"].size());

    ASSERT_EQ(0, h.Run({tarnctl, "repeat", "all"}, &out)) << out;
    ASSERT_EQ(0, h.Run({tarnctl, "queue", "remove", "0"}, &out)) << out;
    ASSERT_EQ(0, h.Run({tarnctl, "status"}, &out)) << out;
    EXPECT_NE(std::string::npos, out.find("local")) << out;
    EXPECT_NE(std::string::npos, out.find("Repeat All")) << out;
    EXPECT_NE(std::string::npos, out.find("/14]")) << out;

    // A page that does not fit one reply is reported, not shown garbled.
    for (int i = 0; i < 12; ++i)
        ASSERT_EQ(0, h.QueueAdd(tarntest::MakeMediaInfo("/music/" + std::string(600, 'y') +
                                                        std::to_string(i) + ".mp3")));
    EXPECT_EQ(1, h.Run({tarnctl, "queue", "--page", "26"}, &out));
    EXPECT_NE(std::string::npos, out.find("smaller page")) << out;

    ASSERT_EQ(0, h.Run({tarnctl, "queue", "clear"}, &out)) << out;
    ASSERT_EQ(0, h.Run({tarnctl, "queue"}, &out)) << out;
    EXPECT_NE(std::string::npos, out.find("0 songs")) << out;

    EXPECT_EQ(0, h.Run({tarnctl, "changed", "set"}, &out)) << out;
    ASSERT_EQ(0, h.Run({tarnctl, "watch", "--count", "3", "--interval", "50"}, &out)) << out;
    int lines = 0;
    for (char c : out)
        lines += c == '\n';
    EXPECT_EQ(3, lines) << out;
    EXPECT_NE(std::string::npos, out.find("vol ")) << out;
    EXPECT_NE(std::string::npos, out.find("* ")) << out;  // the changed mark

    EXPECT_EQ(1, h.Run({tarnctl, "select", "No Such Renderer"}, &out));
    EXPECT_NE(std::string::npos, out.find("no renderer named")) << out;
    EXPECT_EQ(0, h.Run({tarnctl, "select", "local"}, &out)) << out;
    EXPECT_EQ(0, h.Run({tarnctl, "renderers"}, &out)) << out;
    EXPECT_NE(std::string::npos, out.find("renderers")) << out;
    EXPECT_EQ(0, h.Run({tarnctl, "eq", "0", "0", "1.5", "3", "0", "0", "0", "-2", "0", "0"}, &out))
        << out;
    EXPECT_EQ(1, h.Run({tarnctl, "eq", "1", "2"}, &out));
    EXPECT_EQ(0, h.Stop());
}

}  // namespace
