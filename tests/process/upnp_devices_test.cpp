// The real daemon finds real UPnP devices in the test's network namespace: a
// media renderer (gmediarender) and a media server (minidlna) on the veth
// peer address. Their list replies, their capabilities as their service
// descriptions state them, removal by bye-bye and removal of a renderer that
// vanished without one.
#include <gtest/gtest.h>

#include <json/json.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <functional>
#include <string>
#include <thread>

#include "tests/harness/harness.h"
#include "tests/tools/fakedevice/fake_device.h"

namespace {

const char kRendererUdn[] = "uuid:2f1d3c4b-5a69-4788-9aab-bccddeeff001";
const char kServerUdn[] = "uuid:4d696e69-444c-164e-9d41-00000000a001";

bool HaveProgram(const char *path)
{
    return access(path, X_OK) == 0;
}

bool WaitUntil(const std::function<bool()> &condition, int timeoutMs)
{
    auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeoutMs);
    while (std::chrono::steady_clock::now() < deadline) {
        if (condition())
            return true;
        std::this_thread::sleep_for(std::chrono::milliseconds(200));
    }
    return condition();
}

class UpnpDevices : public ::testing::Test {
protected:
    void SetUp() override
    {
        if (!tarntest::InPrivateNetns())
            GTEST_SKIP() << "needs a private network namespace (run under scripts/netns-run)";
        ASSERT_EQ(0, h.Start()) << h.Error();
        // The devices go on the veth end the daemon's libupnp did not take
        // (its HTTP server listens on 49152), so that SSDP crosses the pair.
        daemonIp = fakedev::ListeningAddress(49152);
        ASSERT_FALSE(daemonIp.empty());
        fakedev::PeerInterface(daemonIp, deviceIp, deviceIface);
        serverIp = "10.77.0.1";
    }
    void TearDown() override
    {
        for (pid_t pid : {renderer, server}) {
            if (pid > 0) {
                kill(pid, SIGKILL);
                h.WaitExit(pid, 5000);
            }
        }
    }

    Json::Value List(int action, const char *param = "0 0")
    {
        std::string reply;
        Json::Value value;
        if (h.Request(action, param, &reply) != 0)
            return value;
        Json::Reader reader;
        reader.parse(reply, value);
        return value;
    }
    // The list entry with that UDN, or null.
    Json::Value Find(int action, const std::string &udn)
    {
        Json::Value list = List(action)["list"];
        for (const Json::Value &item : list)
            if (item["udn"].asString() == udn)
                return item;
        return Json::Value();
    }

    pid_t StartRenderer(int port)
    {
        return h.Spawn({"/usr/bin/gmediarender", "-I", deviceIface, "-p", std::to_string(port), "-f",
                        "Test Renderer", "-u", std::string(kRendererUdn + 5), "--gstout-audiopipe",
                        "fakesink sync=true"});
    }
    // minidlna's own announcements do not reach the daemon here, but it
    // answers searches that arrive on its interface: the daemon's searches
    // leave through tveth0, the namespace's multicast route, so minidlna
    // runs there and is found by a search.
    pid_t StartServer()
    {
        std::string dir = h.Root() + "/minidlna";
        mkdir(dir.c_str(), 0755);
        mkdir((dir + "/db").c_str(), 0755);
        mkdir((dir + "/log").c_str(), 0755);
        mkdir((dir + "/media").c_str(), 0755);
        std::string conf = "port=8200\nnetwork_interface=tveth0\nmedia_dir=A," + dir +
                           "/media\nfriendly_name=Test Server\ndb_dir=" + dir + "/db\nlog_dir=" +
                           dir + "/log\nuuid=" + std::string(kServerUdn + 5) +
                           "\ninotify=no\nnotify_interval=60\n";
        FILE *f = fopen((dir + "/minidlna.conf").c_str(), "w");
        if (f == nullptr)
            return -1;
        fputs(conf.c_str(), f);
        fclose(f);
        return h.Spawn({"/usr/sbin/minidlnad", "-f", dir + "/minidlna.conf", "-P",
                        dir + "/minidlna.pid", "-S"});
    }

    tarntest::Harness h;
    std::string daemonIp, deviceIp, deviceIface, serverIp;
    pid_t renderer = -1;
    pid_t server = -1;
};

TEST_F(UpnpDevices, RendererAndServerAreListedWithTheirKeys)
{
    if (!HaveProgram("/usr/bin/gmediarender") || !HaveProgram("/usr/sbin/minidlnad"))
        GTEST_SKIP() << "gmediarender or minidlna not installed";
    // The daemon is up first; the devices announce themselves when they start.
    renderer = StartRenderer(49494);
    server = StartServer();
    ASSERT_GT(renderer, 0);
    ASSERT_GT(server, 0);

    ASSERT_TRUE(WaitUntil([&] { return !Find(ACT_LIST_RENDERERS, kRendererUdn).isNull(); }, 30000))
        << h.Log();
    Json::Value reply = List(ACT_LIST_RENDERERS);
    EXPECT_EQ(0, reply["start"].asInt());
    EXPECT_EQ(0, reply["limit"].asInt());
    EXPECT_EQ(4294967295u, reply["current"].asUInt());
    EXPECT_EQ(1u, reply["total"].asUInt());
    Json::Value r = Find(ACT_LIST_RENDERERS, kRendererUdn);
    EXPECT_EQ("Test Renderer", r["friendly_name"].asString());
    EXPECT_EQ(deviceIp, r["ip"].asString());
    EXPECT_EQ("49494", r["port"].asString());
    EXPECT_EQ(0, r["index"].asInt());
    // gmediarender's descriptions offer SetVolume and REL_TIME seeking.
    ASSERT_TRUE(r["seek"].isBool());
    ASSERT_TRUE(r["set_volume"].isBool());
    EXPECT_TRUE(r["seek"].asBool());
    EXPECT_TRUE(r["set_volume"].asBool());
    EXPECT_EQ(7u, r.size());

    // Searched for once minidlna is up.
    bool found = false;
    for (int attempt = 0; attempt < 6 && !found; ++attempt) {
        EXPECT_EQ(0, h.Request(ACT_SEARCH_SERVERS));
        found = WaitUntil([&] { return !Find(ACT_LIST_SERVERS, kServerUdn).isNull(); }, 10000);
    }
    ASSERT_TRUE(found) << h.Log();
    Json::Value s = Find(ACT_LIST_SERVERS, kServerUdn);
    EXPECT_EQ("Test Server", s["friendly_name"].asString());
    EXPECT_EQ(serverIp, s["ip"].asString());
    EXPECT_EQ("8200", s["port"].asString());
    EXPECT_EQ("http://" + serverIp + ":8200/ctl/ContentDir", s["control_url"].asString());
    EXPECT_EQ(6u, s.size());
    Json::Value servers = List(ACT_LIST_SERVERS);
    EXPECT_FALSE(servers.isMember("current"));
    EXPECT_EQ(1u, servers["total"].asUInt());

    // A refresh search does not duplicate them.
    EXPECT_EQ(0, h.Request(ACT_SEARCH_RENDERERS));
    EXPECT_EQ(0, h.Request(ACT_SEARCH_SERVERS));
    std::this_thread::sleep_for(std::chrono::seconds(3));
    EXPECT_EQ(1u, List(ACT_LIST_RENDERERS)["total"].asUInt());
    EXPECT_EQ(1u, List(ACT_LIST_SERVERS)["total"].asUInt());

    // Paging.
    Json::Value page = List(ACT_LIST_RENDERERS, "1 5");
    EXPECT_EQ(0u, page["list"].size());
    EXPECT_EQ(1, page["start"].asInt());
    EXPECT_EQ(5, page["limit"].asInt());

    // Stopped cleanly, the renderer says bye-bye and leaves its list.
    kill(renderer, SIGTERM);
    EXPECT_TRUE(WaitUntil([&] { return Find(ACT_LIST_RENDERERS, kRendererUdn).isNull(); }, 15000));
    EXPECT_FALSE(Find(ACT_LIST_SERVERS, kServerUdn).isNull());
    // minidlna's own bye-bye does not reach the daemon in this namespace (see
    // StartServer); the same bye-bye, sent for it on the daemon's address
    // (delivered through the local multicast loop), removes the server.
    kill(server, SIGTERM);
    bool gone = false;
    for (int attempt = 0; attempt < 5 && !gone; ++attempt) {
        fakedev::AnnounceService(daemonIp.c_str(), false, kServerUdn,
                                 "urn:schemas-upnp-org:service:ContentDirectory:1", "");
        gone = WaitUntil([&] { return Find(ACT_LIST_SERVERS, kServerUdn).isNull(); }, 3000);
    }
    EXPECT_TRUE(gone);
    h.WaitExit(server, 10000);
    h.WaitExit(renderer, 10000);
    server = renderer = -1;
    EXPECT_EQ(0, h.Stop());
}

TEST_F(UpnpDevices, KilledRendererLeavesOnItsNextFailedAction)
{
    if (!HaveProgram("/usr/bin/gmediarender"))
        GTEST_SKIP() << "gmediarender not installed";
    renderer = StartRenderer(49495);
    ASSERT_GT(renderer, 0);
    ASSERT_TRUE(WaitUntil([&] { return !Find(ACT_LIST_RENDERERS, kRendererUdn).isNull(); }, 30000))
        << h.Log();
    // Selected while alive: its player starts polling it.
    EXPECT_EQ(0, h.Request(ACT_SELECT_PLAYER, "0"));
    std::this_thread::sleep_for(std::chrono::seconds(2));
    // Killed: no bye-bye. The next AVTransport action (a stop here, or the
    // player's polling) finds the connection refused.
    kill(renderer, SIGKILL);
    h.WaitExit(renderer, 5000);
    renderer = -1;
    EXPECT_EQ(0, h.Request(ACT_STOP));
    EXPECT_TRUE(WaitUntil([&] { return Find(ACT_LIST_RENDERERS, kRendererUdn).isNull(); }, 15000))
        << h.Log();
    EXPECT_EQ(0u, List(ACT_LIST_RENDERERS)["total"].asUInt());
    // The daemon goes on serving requests.
    std::string reply;
    EXPECT_EQ(0, h.Request(ACT_GET_STATUS, nullptr, &reply));
    EXPECT_EQ(0, h.Stop());
}

}  // namespace
