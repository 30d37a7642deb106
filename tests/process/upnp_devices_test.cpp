// The real daemon in the test's network namespace, with real UPnP devices
// (gmediarender, minidlna): list replies, capabilities from their service
// descriptions, removal by bye-bye and of a renderer that vanished without one;
// and against misbehaving devices: malformed, huge, deeply nested, endless
// descriptions, service descriptions that never finish, bad LastChange events,
// garbage on the SSDP and GENA ports. The daemon survives and keeps answering.
#include <gtest/gtest.h>

#include <json/json.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <functional>
#include <map>
#include <string>
#include <thread>

#include "tests/harness/harness.h"
#include "tests/tools/fakedevice/fake_device.h"

namespace {

const char kRendererUdn[] = "uuid:2f1d3c4b-5a69-4788-9aab-bccddeeff001";
const char kServerUdn[] = "uuid:4d696e69-444c-164e-9d41-00000000a001";

bool WaitUntil(const std::function<bool()> &condition, int timeoutMs)
{
    auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeoutMs);
    while (std::chrono::steady_clock::now() < deadline) {
        if (condition())
            return true;
        std::this_thread::sleep_for(std::chrono::milliseconds(100));
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
    }
    void TearDown() override
    {
        clientRunning = false;
        if (client.joinable())
            client.join();
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
        if (h.Request(action, param, &reply) == 0)
            Json::Reader().parse(reply, value);
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
    std::string daemonIp, deviceIp, deviceIface, serverIp = "10.77.0.1";
    pid_t renderer = -1, server = -1;
    std::thread client;
    std::atomic<bool> clientRunning{false};
    std::atomic<int> requests{0}, unanswered{0};
};

TEST_F(UpnpDevices, RendererAndServerAreListedWithTheirKeys)
{
    if (access("/usr/bin/gmediarender", X_OK) != 0 || access("/usr/sbin/minidlnad", X_OK) != 0)
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
    if (access("/usr/bin/gmediarender", X_OK) != 0)
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

void Send(int type, const std::string &ip, int port, const std::string &bytes, const std::string &ifaceIp)
{
    int fd = socket(AF_INET, type | SOCK_CLOEXEC, 0);
    in_addr iface{};
    inet_pton(AF_INET, ifaceIp.c_str(), &iface);
    setsockopt(fd, IPPROTO_IP, IP_MULTICAST_IF, &iface, sizeof(iface));
    sockaddr_in to{};
    to.sin_family = AF_INET;
    to.sin_port = htons(static_cast<uint16_t>(port));
    inet_pton(AF_INET, ip.c_str(), &to.sin_addr);
    if (type == SOCK_DGRAM || connect(fd, reinterpret_cast<sockaddr *>(&to), sizeof(to)) == 0)
        sendto(fd, bytes.data(), bytes.size(), MSG_NOSIGNAL, type == SOCK_DGRAM ? reinterpret_cast<sockaddr *>(&to) : nullptr,
               type == SOCK_DGRAM ? sizeof(to) : 0);
    close(fd);
}

std::string Uuid(int n)
{
    char buf[64];
    snprintf(buf, sizeof(buf), "uuid:0bad0bad-0000-4000-8000-%012d", n);
    return buf;
}

TEST_F(UpnpDevices, HostileDevicesNeitherCrashNorSilenceTheDaemon)
{
    const char kAvt[] = "urn:schemas-upnp-org:service:AVTransport:1";
    const char kRcs[] = "urn:schemas-upnp-org:service:RenderingControl:1";
    // Control requests from another thread all along; each must be answered within 3 s.
    clientRunning = true;
    client = std::thread([this] {
        for (std::string reply; clientRunning; std::this_thread::sleep_for(std::chrono::milliseconds(50)))
            if (h.Request(++requests % 2 ? ACT_LIST_RENDERERS : ACT_GET_STATUS, "0 0", &reply, 3000) != 0)
                ++unanswered;
    });
    fakedev::FakeHttpServer bad;
    ASSERT_GT(bad.Start(daemonIp.c_str(), 0), 0);
    std::string deep, flat = "<root><device><UDN>" + Uuid(1) + "</UDN>";
    for (int i = 0; i < 200000; ++i)
        deep += "<d>";
    for (int i = 0; i < 60000; ++i)
        flat += "<x/>";
    flat += "</device></root>";
    std::map<std::string, fakedev::Route> routes = {
        {"/malformed.xml", {"<root><device><UDN>" + Uuid(2) + "</UDN><serv"}}, {"/deep.xml", {deep}},
        {"/flat.xml", {flat}}, {"/stall.xml", {fakedev::DeviceDescription(Uuid(3), "s", {}), fakedev::Mode::Stall}},
        {"/endless.xml", {"<root>", fakedev::Mode::Endless}}, {"/huge.xml", {"<root>", fakedev::Mode::Huge}},
        {"/garbage.xml", {"", fakedev::Mode::Garbage}}, {"/close.xml", {"", fakedev::Mode::Close}},
        {"/notxml.xml", {std::string(5000, '\xff')}},
        // A renderer whose RenderingControl description never finishes.
        {"/slow.xml", {fakedev::DeviceDescription(Uuid(5), "slow", {{kAvt, "AVTransport"}, {kRcs, "RenderingControl"}})}},
        {"/RenderingControl/scpd.xml", {fakedev::RcsScpd(), fakedev::Mode::Stall}}};
    for (const auto &route : routes)
        bad.SetRoute(route.first, route.second);
    for (int round = 0; round < 3; ++round) {
        for (const auto &route : routes)
            fakedev::AnnounceService(daemonIp.c_str(), true, route.first == "/slow.xml" ? Uuid(5) : Uuid(9), kAvt,
                                     bad.BaseUrl() + route.first);
        fakedev::AnnounceService(daemonIp.c_str(), true, Uuid(6), kAvt, "http://");
        fakedev::AnnounceService(daemonIp.c_str(), true, Uuid(7), kAvt, std::string(3000, 'h'));
        // Garbage on the SSDP port and on libupnp's HTTP port (GENA).
        Send(SOCK_DGRAM, "239.255.255.250", 1900, "NOTIFY * HTTP/1.1\r\n\xff\xfe\r\n\r\n", daemonIp);
        Send(SOCK_DGRAM, "239.255.255.250", 1900, std::string(1400, 'A'), daemonIp);
        Send(SOCK_STREAM, daemonIp, 49152, "NOTIFY / HTTP/1.1\r\nSID: uuid:x\r\nNT: upnp:event\r\nNTS: "
                                           "upnp:propchange\r\nSEQ: 0\r\nCONTENT-LENGTH: 99999999\r\n\r\n<a>", daemonIp);
        Send(SOCK_STREAM, daemonIp, 49152, std::string(20000, '\x01'), daemonIp);
        std::this_thread::sleep_for(std::chrono::milliseconds(500));
    }

    // A well-behaved renderer is still found, probed, and takes bad events.
    fakedev::FakeHttpServer good;
    ASSERT_GT(good.Start(daemonIp.c_str(), 0), 0);
    std::string goodUdn = Uuid(100);
    good.SetRoute("/description.xml", {fakedev::DeviceDescription(goodUdn, "Good", {{kAvt, "AVTransport"},
                                       {kRcs, "RenderingControl"}})});
    good.SetRoute("/AVTransport/scpd.xml", {fakedev::AvtScpd()});
    good.SetRoute("/RenderingControl/scpd.xml", {fakedev::RcsScpd()});
    for (int i = 0; i < 5 && Find(ACT_LIST_RENDERERS, goodUdn).isNull(); ++i) {
        fakedev::AnnounceService(daemonIp.c_str(), true, goodUdn, kAvt, good.BaseUrl() + "/description.xml");
        WaitUntil([&] { return !Find(ACT_LIST_RENDERERS, goodUdn).isNull(); }, 4000);
    }
    Json::Value entry = Find(ACT_LIST_RENDERERS, goodUdn);
    ASSERT_FALSE(entry.isNull()) << h.Log();
    EXPECT_TRUE(entry["seek"].asBool() && entry["set_volume"].asBool());
    ASSERT_TRUE(good.WaitFor("SUBSCRIBE", "/RenderingControl/event", 1, 5000));
    fakedev::Request sub = good.RequestsOf("SUBSCRIBE", "/RenderingControl/event")[0];
    std::string nested;
    for (int i = 0; i < 5000; ++i)
        nested += "<n>";
    int seq = 0;
    for (const std::string &body : {fakedev::LastChangeEvent("<Event><Volume val=\"1\"></Event>"),
                                    fakedev::LastChangeEvent(nested), fakedev::LastChangeEvent(std::string(7000, '<')),
                                    std::string("not xml at all")})
        fakedev::SendGenaEvent(sub.Header("CALLBACK"), sub.issuedSid, seq++, body);
    EXPECT_TRUE(h.WaitLog("Failed to parse LastChange, err=", 5000)) << h.Log();

    // The slow renderer is listed once its probe gives up; the others never.
    EXPECT_TRUE(WaitUntil([&] { return !Find(ACT_LIST_RENDERERS, Uuid(5)).isNull(); }, 30000));
    for (int n : {1, 2, 3, 6, 7, 9})
        EXPECT_TRUE(Find(ACT_LIST_RENDERERS, Uuid(n)).isNull()) << n;
    clientRunning = false;
    client.join();
    EXPECT_GT(requests.load(), 20);
    EXPECT_EQ(0, unanswered.load()) << "of " << requests.load() << " requests";

    // Stopped while a probe waits on a stalled service description: the daemon still ends promptly.
    bad.SetRoute("/last.xml", {fakedev::DeviceDescription(Uuid(8), "stalling", {{kAvt, "AVTransport8"},
                               {kRcs, "RenderingControl"}})});
    size_t stalled = bad.RequestsOf("GET", "/RenderingControl/scpd.xml").size();
    for (int i = 0; i < 5 && bad.RequestsOf("GET", "/RenderingControl/scpd.xml").size() == stalled; ++i) {
        fakedev::AnnounceService(daemonIp.c_str(), true, Uuid(8), kAvt, bad.BaseUrl() + "/last.xml");
        bad.WaitFor("GET", "/RenderingControl/scpd.xml", stalled + 1, 3000);
    }
    EXPECT_GT(bad.RequestsOf("GET", "/RenderingControl/scpd.xml").size(), stalled);
    auto t0 = std::chrono::steady_clock::now();
    EXPECT_EQ(0, h.Stop());
    EXPECT_LT(std::chrono::duration<double>(std::chrono::steady_clock::now() - t0).count(), 5.0);
}

}  // namespace
