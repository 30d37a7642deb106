// Player selection with a real renderer (gmediarender) in the test's network
// namespace: where requests go, source changes, the renderer leaving.
#include <gtest/gtest.h>

#include <csignal>
#include <chrono>
#include <functional>
#include <string>
#include <thread>
#include <unistd.h>

#include <json/json.h>

#include "daemon/tarn_types.h"
#include "tests/harness/harness.h"
#include "tests/tools/fakedevice/fake_device.h"

namespace {

const char kUdn[] = "uuid:2f1d3c4b-5a69-4788-9aab-bccddeeff0a1";

bool WaitUntil(const std::function<bool()> &condition, int timeoutMs)
{
    auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeoutMs);
    while (std::chrono::steady_clock::now() < deadline) {
        if (condition())
            return true;
        std::this_thread::sleep_for(std::chrono::milliseconds(50));
    }
    return condition();
}

class SelectionTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        if (access("/usr/bin/gmediarender", X_OK) != 0)
            GTEST_SKIP() << "gmediarender not installed";
        ASSERT_TRUE(tarntest::InPrivateNetns());
        ASSERT_EQ(0, h.Start()) << h.Error();
        std::string daemonIp = fakedev::ListeningAddress(49152);
        ASSERT_FALSE(daemonIp.empty());
        fakedev::PeerInterface(daemonIp, deviceIp, deviceIface);
        renderer = h.Spawn({"/usr/bin/gmediarender", "-I", deviceIface, "-p", "49496", "-f",
                            "Selection Renderer", "-u", std::string(kUdn + 5), "--gstout-audiopipe",
                            "fakesink sync=true"});
        ASSERT_GT(renderer, 0);
        ASSERT_TRUE(WaitUntil([&] { return Json("0 10", ACT_LIST_RENDERERS)["total"].asUInt() == 1; },
                              30000))
            << h.Log();
    }
    void TearDown() override
    {
        if (renderer > 0) {
            kill(renderer, SIGKILL);
            h.WaitExit(renderer, 5000);
        }
    }
    Json::Value Json(const char *param, int action)
    {
        std::string reply;
        Json::Value v;
        std::unique_ptr<Json::CharReader> r(Json::CharReaderBuilder().newCharReader());
        if (h.Request(action, param, &reply) == 0)
            r->parse(reply.data(), reply.data() + reply.size(), &v, nullptr);
        return v;
    }
    Json::Value Status() { return Json(nullptr, ACT_GET_STATUS); }

    tarntest::Harness h;
    std::string deviceIp, deviceIface;
    pid_t renderer = -1;
};

TEST_F(SelectionTest, RequestsFollowTheSelectedPlayer)
{
    EXPECT_TRUE(Status().isMember("PlayerState"));
    std::string reply;
    ASSERT_EQ(0, h.Request(ACT_SELECT_PLAYER, "0", &reply));
    EXPECT_EQ("null\n", reply);
    EXPECT_EQ(0, Json("0 1", ACT_LIST_RENDERERS)["current"].asInt());
    EXPECT_TRUE(Status().isMember("TransportState")) << Status();

    // The renderer player refuses what only the local player does.
    ASSERT_EQ(0, h.Request(ACT_SET_EQUALIZER, "0.0 0.0 0.0 0.0 0.0 0.0 0.0 0.0 0.0 0.0", &reply));
    EXPECT_EQ("null\n", reply);
    ASSERT_EQ(0, h.Request(ACT_CYCLE_REPEAT_MODE, nullptr, &reply));
    EXPECT_EQ("null\n", reply);
    EXPECT_EQ(1, h.CountLog("upnpplayer:739 Action [35] not handled")) << h.Log();
    EXPECT_EQ(1, h.CountLog("upnpplayer:739 Action [30] not handled")) << h.Log();

    // The renderer's queue is its own.
    ASSERT_EQ(0, h.QueueAdd(tarntest::MakeMediaInfo("/music/renderer-song.mp3")));
    EXPECT_EQ(1, Json("0 10", ACT_QUEUE_LIST)["total"].asInt());
    ASSERT_EQ(0, h.Request(ACT_SELECT_PLAYER, "-1", &reply));
    EXPECT_TRUE(Status().isMember("PlayerState"));
    EXPECT_EQ(0, Json("0 10", ACT_QUEUE_LIST)["total"].asInt());

    // A source change returns to the local player even when it fails.
    ASSERT_EQ(0, h.Request(ACT_SELECT_PLAYER, "0", &reply));
    EXPECT_TRUE(Status().isMember("TransportState"));
    ASSERT_EQ(0, h.Request(ACT_SOURCE_NEXT, nullptr, &reply));
    EXPECT_TRUE(Status().isMember("PlayerState"));
    // The renderer player survived: selecting again finds its queue.
    ASSERT_EQ(0, h.Request(ACT_SELECT_PLAYER, "0", &reply));
    EXPECT_EQ(1, Json("0 10", ACT_QUEUE_LIST)["total"].asInt());
}

TEST_F(SelectionTest, SelectedRendererLeavingTheNetwork)
{
    std::string reply;
    ASSERT_EQ(0, h.Request(ACT_CLEAR_CHANGED, nullptr, &reply));
    ASSERT_EQ(0, h.Request(ACT_SELECT_PLAYER, "0", &reply));
    const PublishedStatusShm *pub = h.PublishedSegment();
    ASSERT_NE(nullptr, pub);
    EXPECT_EQ(0, pub->changed);

    // Killed without a bye-bye: the next action fails, the renderer, its
    // player and the selection are dropped.
    kill(renderer, SIGKILL);
    h.WaitExit(renderer, 10000);
    renderer = -1;
    ASSERT_EQ(0, h.Request(ACT_STOP, nullptr, &reply, 15000));
    ASSERT_TRUE(WaitUntil([&] { return Json("0 10", ACT_LIST_RENDERERS)["total"].asUInt() == 0; },
                          15000))
        << Json("0 10", ACT_LIST_RENDERERS) << h.Log();
    EXPECT_TRUE(WaitUntil([&] { return pub->changed == 1; }, 5000));
    // No player selected: player actions answer null.
    EXPECT_TRUE(Status().isNull());
    ASSERT_EQ(0, h.Request(ACT_QUEUE_LIST, "0 10", &reply));
    EXPECT_EQ("null\n", reply);
    EXPECT_EQ(0, h.CountLog("No upnp player index"));
    ASSERT_EQ(0, h.Request(ACT_SELECT_PLAYER, "-1", &reply));
    EXPECT_TRUE(Status().isMember("PlayerState"));
}

}  // namespace
