// The real daemon with real UPnP devices (gmediarender, minidlna): lists,
// capabilities, an action, removal by failure and by bye-bye; and against
// misbehaving devices: bad descriptions and events, garbage on its ports.
#include <gtest/gtest.h>

#include <arpa/inet.h>
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
const char kAvt[] = "urn:schemas-upnp-org:service:AVTransport:1";
const char kRcs[] = "urn:schemas-upnp-org:service:RenderingControl:1";

bool WaitUntil(const std::function<bool()> &condition, int timeoutMs)
{
    for (int waited = 0; !condition(); waited += 100) {
        if (waited >= timeoutMs)
            return false;
        std::this_thread::sleep_for(std::chrono::milliseconds(100));
    }
    return true;
}

std::string Uuid(int n)
{
    char buf[64];
    snprintf(buf, sizeof(buf), "uuid:0bad0bad-0000-4000-8000-%012d", n);
    return buf;
}

class UpnpDevices : public ::testing::Test {
protected:
    void SetUp() override
    {
        if (!tarntest::InPrivateNetns())
            GTEST_SKIP() << "needs a private network namespace (run under scripts/netns-run)";
        ASSERT_EQ(0, h.Start()) << h.Error();
        // Devices go on the veth end the daemon's libupnp did not take.
        daemonIp = fakedev::ListeningAddress(49152);
        ASSERT_FALSE(daemonIp.empty());
        fakedev::PeerInterface(daemonIp, deviceIp, deviceIface);
    }
    void TearDown() override
    {
        clientRunning = false;
        if (client.joinable())
            client.join();
        for (pid_t pid : {renderer, server})
            if (pid > 0 && kill(pid, SIGKILL) == 0)
                h.WaitExit(pid, 5000);
    }
    Json::Value Ask(int action, const char *param = "0 0")
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
        Json::Value list = Ask(action)["list"];
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
    // minidlna's announcements do not reach the daemon, but it answers searches,
    // which leave through tveth0 (the multicast route): so it runs there.
    pid_t StartServer()
    {
        std::string dir = h.Root() + "/minidlna";
        for (const char *sub : {"", "/db", "/log", "/media"})
            mkdir((dir + sub).c_str(), 0755);
        FILE *f = fopen((dir + "/minidlna.conf").c_str(), "w");
        if (f == nullptr)
            return -1;
        fprintf(f, "port=8200\nnetwork_interface=tveth0\nmedia_dir=A,%s/media\nfriendly_name=Test Server\n"
                   "db_dir=%s/db\nlog_dir=%s/log\nuuid=%s\ninotify=no\nnotify_interval=60\n",
                dir.c_str(), dir.c_str(), dir.c_str(), kServerUdn + 5);
        fclose(f);
        return h.Spawn({"/usr/sbin/minidlnad", "-f", dir + "/minidlna.conf", "-P", dir + "/minidlna.pid", "-S"});
    }

    tarntest::Harness h;
    std::string daemonIp, deviceIp, deviceIface;
    pid_t renderer = -1, server = -1;
    std::thread client;
    std::atomic<bool> clientRunning{false};
    std::atomic<int> requests{0}, unanswered{0};
};

TEST_F(UpnpDevices, ListedWithTheirKeysDrivenAndRemovedByFailureAndByeBye)
{
    if (access("/usr/bin/gmediarender", X_OK) != 0 || access("/usr/sbin/minidlnad", X_OK) != 0)
        GTEST_SKIP() << "gmediarender or minidlna not installed";
    // The daemon is up first; the devices announce themselves when they start.
    ASSERT_GT(renderer = StartRenderer(49494), 0);
    ASSERT_GT(server = StartServer(), 0);
    ASSERT_TRUE(WaitUntil([&] { return !Find(ACT_LIST_RENDERERS, kRendererUdn).isNull(); }, 30000)) << h.Log();
    Json::Value reply = Ask(ACT_LIST_RENDERERS), r = reply["list"][0];
    EXPECT_EQ("0 0 4294967295 1", reply["start"].asString() + " " + reply["limit"].asString() + " " +
                                      reply["current"].asString() + " " + reply["total"].asString());
    EXPECT_EQ(7u, r.size());
    EXPECT_EQ("Test Renderer " + deviceIp + " 49494 0", r["friendly_name"].asString() + " " + r["ip"].asString() +
                                                            " " + r["port"].asString() + " " + r["index"].asString());
    // gmediarender's service descriptions offer REL_TIME seeking and SetVolume.
    EXPECT_TRUE(r["seek"].isBool() && r["seek"].asBool());
    EXPECT_TRUE(r["set_volume"].isBool() && r["set_volume"].asBool());

    bool found = false;
    for (int attempt = 0; attempt < 6 && !found; ++attempt) {
        EXPECT_EQ(0, h.Request(ACT_SEARCH_SERVERS));
        found = WaitUntil([&] { return !Find(ACT_LIST_SERVERS, kServerUdn).isNull(); }, 10000);
    }
    ASSERT_TRUE(found) << h.Log();
    reply = Ask(ACT_LIST_SERVERS);
    Json::Value s = reply["list"][0];
    EXPECT_EQ(6u, s.size());
    EXPECT_EQ("Test Server 10.77.0.1 8200 http://10.77.0.1:8200/ctl/ContentDir",
              s["friendly_name"].asString() + " " + s["ip"].asString() + " " + s["port"].asString() + " " +
                  s["control_url"].asString());
    EXPECT_FALSE(reply.isMember("current"));
    EXPECT_EQ(1u, reply["total"].asUInt());

    // Selected, the renderer takes a SetVolume; its event carries the volume into its record.
    EXPECT_EQ(0, h.Request(ACT_SELECT_PLAYER, "0"));
    EXPECT_EQ(0, h.Request(ACT_SET_VOLUME, "37"));
    EXPECT_TRUE(WaitUntil([&] { return Ask(ACT_GET_STATUS)["Volume"] == "37"; }, 5000)) << h.Log();
    // Killed: no bye-bye. The next AVTransport action (a stop here, or the
    // player's polling) finds the connection refused.
    kill(renderer, SIGKILL);
    h.WaitExit(renderer, 5000);
    renderer = -1;
    EXPECT_EQ(0, h.Request(ACT_STOP));
    EXPECT_TRUE(WaitUntil([&] { return Ask(ACT_LIST_RENDERERS)["total"].asUInt() == 0; }, 15000)) << h.Log();
    EXPECT_FALSE(Find(ACT_LIST_SERVERS, kServerUdn).isNull());
    // minidlna's own bye-bye does not reach the daemon (see StartServer); the same
    // bye-bye, sent on the daemon's address through the multicast loop, removes it.
    kill(server, SIGTERM);
    bool gone = false;
    for (int attempt = 0; attempt < 5 && !gone; ++attempt) {
        fakedev::AnnounceService(daemonIp, false, kServerUdn, "urn:schemas-upnp-org:service:ContentDirectory:1", "");
        gone = WaitUntil([&] { return Find(ACT_LIST_SERVERS, kServerUdn).isNull(); }, 3000);
    }
    EXPECT_TRUE(gone);
    EXPECT_EQ(0, h.Stop());
}

TEST_F(UpnpDevices, HostileDevicesNeitherCrashNorSilenceTheDaemon)
{
    // Control requests from another thread all along; each must be answered within 3 s.
    clientRunning = true;
    client = std::thread([this] {
        for (std::string reply; clientRunning; std::this_thread::sleep_for(std::chrono::milliseconds(50)))
            if (h.Request(++requests % 2 ? ACT_LIST_RENDERERS : ACT_GET_STATUS, "0 0", &reply, 3000) != 0)
                ++unanswered;
    });
    fakedev::FakeHttpServer bad, good;
    ASSERT_GT(bad.Start(daemonIp.c_str()), 0);
    std::string deep, flat = "<root><device><UDN>" + Uuid(1) + "</UDN>";
    for (int i = 0; i < 200000; ++i)
        deep += "<d>";
    for (int i = 0; i < 60000; ++i)
        flat += "<x/>";
    std::map<std::string, fakedev::Route> routes = {
        {"/malformed.xml", {"<root><device><UDN>" + Uuid(2) + "</UDN><serv"}}, {"/deep.xml", {deep}},
        {"/flat.xml", {flat + "</device></root>"}}, {"/notxml.xml", {std::string(5000, '\xff')}},
        {"/stall.xml", {fakedev::DeviceDescription(Uuid(3), "s", {}), fakedev::Mode::Stall}},
        {"/endless.xml", {"<root>", fakedev::Mode::Endless}}, {"/huge.xml", {"<root>", fakedev::Mode::Huge}},
        {"/garbage.xml", {"", fakedev::Mode::Garbage}}, {"/close.xml", {"", fakedev::Mode::Close}},
        // A renderer whose RenderingControl description never finishes.
        {"/slow.xml", {fakedev::DeviceDescription(Uuid(5), "slow", {{kAvt, "A"}, {kRcs, "R"}})}},
        {"/R/scpd.xml", {fakedev::RcsScpd(), fakedev::Mode::Stall}}};
    for (const auto &route : routes)
        bad.SetRoute(route.first, route.second);
    for (int round = 0; round < 3; ++round) {
        for (const auto &route : routes)
            fakedev::AnnounceService(daemonIp, true, Uuid(route.first == "/slow.xml" ? 5 : 9), kAvt,
                                     bad.BaseUrl() + route.first);
        fakedev::AnnounceService(daemonIp, true, Uuid(6), kAvt, "http://");
        fakedev::AnnounceService(daemonIp, true, Uuid(7), kAvt, std::string(3000, 'h'));
        // Garbage on the SSDP port and on libupnp's HTTP (GENA) port.
        fakedev::SendRaw(SOCK_DGRAM, daemonIp, "239.255.255.250", 1900, "NOTIFY * HTTP/1.1\r\n\xff\xfe\r\n\r\n");
        fakedev::SendRaw(SOCK_DGRAM, daemonIp, "239.255.255.250", 1900, std::string(1400, 'A'));
        fakedev::SendRaw(SOCK_STREAM, daemonIp, daemonIp, 49152, "NOTIFY / HTTP/1.1\r\nSID: uuid:x\r\nNT: upnp:event"
                         "\r\nNTS: upnp:propchange\r\nSEQ: 0\r\nCONTENT-LENGTH: 99999999\r\n\r\n<a>");
        fakedev::SendRaw(SOCK_STREAM, daemonIp, daemonIp, 49152, std::string(20000, '\x01'));
        std::this_thread::sleep_for(std::chrono::milliseconds(500));
    }

    // A well-behaved renderer is still found and probed, and takes bad events.
    ASSERT_GT(good.Start(daemonIp.c_str()), 0);
    good.SetRoute("/d.xml", {fakedev::DeviceDescription(Uuid(100), "Good", {{kAvt, "A"}, {kRcs, "R"}})});
    good.SetRoute("/A/scpd.xml", {fakedev::AvtScpd()});
    good.SetRoute("/R/scpd.xml", {fakedev::RcsScpd()});
    for (int i = 0; i < 5 && Find(ACT_LIST_RENDERERS, Uuid(100)).isNull(); ++i) {
        fakedev::AnnounceService(daemonIp, true, Uuid(100), kAvt, good.BaseUrl() + "/d.xml");
        WaitUntil([&] { return !Find(ACT_LIST_RENDERERS, Uuid(100)).isNull(); }, 4000);
    }
    Json::Value entry = Find(ACT_LIST_RENDERERS, Uuid(100));
    ASSERT_FALSE(entry.isNull()) << h.Log();
    EXPECT_TRUE(entry["seek"].asBool() && entry["set_volume"].asBool());
    ASSERT_TRUE(good.WaitFor("SUBSCRIBE", "/R/event", 1, 5000));
    fakedev::Request sub = good.RequestsOf("SUBSCRIBE", "/R/event")[0];
    int seq = 0;
    for (const std::string &body : {fakedev::LastChangeEvent("<Event><Volume val=\"1\"></Event>"),
                                    fakedev::LastChangeEvent(deep.substr(0, 15000)),
                                    fakedev::LastChangeEvent(std::string(7000, '<')), std::string("not xml at all")})
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
    bad.SetRoute("/last.xml", {fakedev::DeviceDescription(Uuid(8), "stalling", {{kAvt, "A8"}, {kRcs, "R"}})});
    size_t stalled = bad.RequestsOf("GET", "/R/scpd.xml").size();
    for (int i = 0; i < 5 && (i == 0 || !bad.WaitFor("GET", "/R/scpd.xml", stalled + 1, 3000)); ++i)
        fakedev::AnnounceService(daemonIp, true, Uuid(8), kAvt, bad.BaseUrl() + "/last.xml");
    EXPECT_TRUE(bad.WaitFor("GET", "/R/scpd.xml", stalled + 1, 3000));
    auto t0 = std::chrono::steady_clock::now();
    EXPECT_EQ(0, h.Stop());
    EXPECT_LT(std::chrono::duration<double>(std::chrono::steady_clock::now() - t0).count(), 5.0);
}

// A LAN that announces more devices than the daemon lists, and a flood of
// event messages that match no subscription, stop half-way or are not HTTP:
// the daemon lists at most its limit, keeps answering, and its memory stays
// bounded.
TEST_F(UpnpDevices, FloodsOfDevicesAndEventsKeepTheDaemonAnswering)
{
    const int kDevices = 60, kListMax = 40;
    EXPECT_EQ(0, h.Stop());
    ASSERT_EQ(0, h.WriteFile("/etc/tarninfo.conf", "upnp_devices_max=" + std::to_string(kListMax) + "\n"));
    ASSERT_EQ(0, h.Start()) << h.Error();
    daemonIp = fakedev::ListeningAddress(49152);
    std::atomic<long> slowestUs{0};
    clientRunning = true;
    client = std::thread([this, &slowestUs] {
        for (std::string reply; clientRunning; std::this_thread::sleep_for(std::chrono::milliseconds(20))) {
            auto t0 = std::chrono::steady_clock::now();
            if (h.Request(ACT_GET_STATUS, "", &reply, 3000) != 0)
                ++unanswered;
            ++requests;
            long us = static_cast<long>(std::chrono::duration_cast<std::chrono::microseconds>(
                                            std::chrono::steady_clock::now() - t0).count());
            if (us > slowestUs)
                slowestUs = us;
        }
    });
    long rssBefore = tarntest::ResidentKiB(h.Pid());
    fakedev::FakeHttpServer lan;
    ASSERT_GT(lan.Start(daemonIp.c_str()), 0);
    lan.SetRoute("/A/scpd.xml", {fakedev::AvtScpd()});
    lan.SetRoute("/R/scpd.xml", {fakedev::RcsScpd()});
    auto url = [&lan](int i) { return lan.BaseUrl() + "/d" + std::to_string(i) + ".xml"; };
    for (int i = 1; i <= kDevices; ++i)
        lan.SetRoute("/d" + std::to_string(i) + ".xml",
                     {fakedev::DeviceDescription(Uuid(1000 + i), "Flood " + std::to_string(i), {{kAvt, "A"}, {kRcs, "R"}})});
    auto listed = [this] { return Ask(ACT_LIST_RENDERERS, "0 1")["total"].asInt(); };
    for (int round = 0; round < 3 && listed() < kListMax; ++round) {
        for (int i = 1; i <= kDevices; ++i)
            fakedev::AnnounceService(daemonIp, true, Uuid(1000 + i), kAvt, url(i));
        WaitUntil([&] { return listed() >= kListMax; }, 20000);
    }
    // Announced again: the full list takes none of the rest.
    for (int i = kDevices; i >= 1; --i)
        fakedev::AnnounceService(daemonIp, true, Uuid(1000 + i), kAvt, url(i));
    std::this_thread::sleep_for(std::chrono::milliseconds(1000));
    EXPECT_EQ(kListMax, listed());
    EXPECT_TRUE(h.WaitLog("Too many renderers listed", 1000)) << h.Log();
    // The whole list does not fit one reply: it comes cut by whole entries.
    Json::Value all = Ask(ACT_LIST_RENDERERS, "0 0");
    EXPECT_EQ(kListMax, all["total"].asInt());
    EXPECT_GT(all["list"].size(), 10u);
    EXPECT_LT(all["list"].size(), static_cast<unsigned>(kListMax));

    // Event messages sent without waiting for an answer.
    auto sendAndGo = [this](const std::string &bytes) {
        int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
        sockaddr_in to{};
        to.sin_family = AF_INET;
        to.sin_port = htons(49152);
        inet_pton(AF_INET, daemonIp.c_str(), &to.sin_addr);
        if (connect(fd, reinterpret_cast<sockaddr *>(&to), sizeof(to)) == 0)
            fakedev::SendAll(fd, bytes);
        close(fd);
    };
    for (int i = 0; i < 1500; ++i) {
        std::string sid = "uuid:flood-" + std::to_string(i);
        std::string body = fakedev::LastChangeEvent(std::string(200, '<'));
        if (i % 3 == 0)
            sendAndGo("NOTIFY / HTTP/1.1\r\nNT: upnp:event\r\nNTS: upnp:propchange\r\nSID: " + sid +
                      "\r\nSEQ: 0\r\nCONTENT-LENGTH: " + std::to_string(body.size()) + "\r\n\r\n" + body);
        else if (i % 3 == 1)
            sendAndGo("NOTIFY / HTTP/1.1\r\nSID: " + sid + "\r\nCONTENT-LENGTH: 50000\r\n\r\n<e:");
        else
            sendAndGo(std::string(3000, static_cast<char>(i)));
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(500));
    clientRunning = false;
    client.join();
    long rssAfter = tarntest::ResidentKiB(h.Pid());
    printf("flood: %d requests, slowest answer %.1f ms, resident %ld -> %ld KiB\n", requests.load(),
           slowestUs.load() / 1000.0, rssBefore, rssAfter);
    EXPECT_GT(requests.load(), 20);
    EXPECT_EQ(0, unanswered.load()) << "of " << requests.load() << " requests";
    EXPECT_GT(rssBefore, 0);
    // ThreadSanitizer keeps a shadow of every allocation and its history.
#ifdef TARN_UNDER_TSAN
    const long kGrowthKiB = 160 * 1024;
#else
    const long kGrowthKiB = 32 * 1024;
#endif
    EXPECT_LT(rssAfter - rssBefore, kGrowthKiB) << "KiB";
    EXPECT_EQ(kListMax, listed());
}

}  // namespace
