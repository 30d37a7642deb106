// The real daemon against misbehaving UPnP devices in the test's network
// namespace: malformed, huge, deeply nested and never-ending descriptions,
// service descriptions that never finish, bad LastChange events, garbage on
// the SSDP and GENA ports. The daemon must survive, keep answering control
// requests, and still find a well-behaved renderer.
#include <gtest/gtest.h>

#include <json/json.h>
#include <signal.h>

#include <atomic>
#include <chrono>
#include <fstream>
#include <functional>
#include <sstream>
#include <string>
#include <thread>

#include "tests/harness/harness.h"
#include "tests/tools/fakedevice/fake_device.h"

namespace {

const char kAvt[] = "urn:schemas-upnp-org:service:AVTransport:1";
const char kRcs[] = "urn:schemas-upnp-org:service:RenderingControl:1";

std::string Fixture(const char *name)
{
    std::ifstream in(tarntest::SourcePath("tests/fixtures/upnp/") + name);
    std::stringstream ss;
    ss << in.rdbuf();
    return ss.str();
}

std::string Uuid(int n)
{
    char buf[64];
    snprintf(buf, sizeof(buf), "uuid:0bad0bad-0000-4000-8000-%012d", n);
    return buf;
}

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

void SendUdp(const std::string &ip, int port, const std::string &bytes, const char *ifaceIp)
{
    int fd = socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    if (fd < 0)
        return;
    in_addr iface{};
    inet_pton(AF_INET, ifaceIp, &iface);
    setsockopt(fd, IPPROTO_IP, IP_MULTICAST_IF, &iface, sizeof(iface));
    sockaddr_in to{};
    to.sin_family = AF_INET;
    to.sin_port = htons(static_cast<uint16_t>(port));
    inet_pton(AF_INET, ip.c_str(), &to.sin_addr);
    sendto(fd, bytes.data(), bytes.size(), 0, reinterpret_cast<sockaddr *>(&to), sizeof(to));
    close(fd);
}

void SendTcp(const std::string &ip, int port, const std::string &bytes)
{
    int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd < 0)
        return;
    sockaddr_in to{};
    to.sin_family = AF_INET;
    to.sin_port = htons(static_cast<uint16_t>(port));
    inet_pton(AF_INET, ip.c_str(), &to.sin_addr);
    if (connect(fd, reinterpret_cast<sockaddr *>(&to), sizeof(to)) == 0)
        send(fd, bytes.data(), bytes.size(), MSG_NOSIGNAL);
    close(fd);
}

class UpnpHostile : public ::testing::Test {
protected:
    void SetUp() override
    {
        if (!tarntest::InPrivateNetns())
            GTEST_SKIP() << "needs a private network namespace (run under scripts/netns-run)";
        ASSERT_EQ(0, h.Start()) << h.Error();
        daemonIp = fakedev::ListeningAddress(49152);
        ASSERT_FALSE(daemonIp.empty());
    }

    Json::Value Renderers()
    {
        std::string reply;
        Json::Value value;
        if (h.Request(ACT_LIST_RENDERERS, "0 0", &reply) != 0)
            return value;
        Json::Reader reader;
        reader.parse(reply, value);
        return value;
    }
    int RendererIndex(const std::string &udn)
    {
        Json::Value list = Renderers()["list"];
        for (const Json::Value &item : list)
            if (item["udn"].asString() == udn)
                return item["index"].asInt();
        return -1;
    }
    // Sends control requests from another thread until stopped; counts
    // those left without a reply.
    void StartClient()
    {
        clientRunning = true;
        client = std::thread([this] {
            while (clientRunning) {
                std::string reply;
                ++requests;
                if (h.Request(requests % 2 ? ACT_LIST_RENDERERS : ACT_GET_STATUS,
                              requests % 2 ? "0 0" : nullptr, &reply, 3000) != 0)
                    ++unanswered;
                std::this_thread::sleep_for(std::chrono::milliseconds(50));
            }
        });
    }
    void StopClient()
    {
        clientRunning = false;
        if (client.joinable())
            client.join();
    }
    void TearDown() override { StopClient(); }

    tarntest::Harness h;
    std::string daemonIp;
    std::thread client;
    std::atomic<bool> clientRunning{false};
    std::atomic<int> requests{0};
    std::atomic<int> unanswered{0};
};

TEST_F(UpnpHostile, DaemonSurvivesAndKeepsAnswering)
{
    StartClient();
    fakedev::FakeHttpServer bad;
    ASSERT_GT(bad.Start(daemonIp.c_str(), 0), 0);
    std::string deep;
    for (int i = 0; i < 200000; ++i)
        deep += "<d>";
    std::string flat = "<root><device><UDN>" + Uuid(1) + "</UDN>";
    for (int i = 0; i < 60000; ++i)
        flat += "<x/>";
    flat += "</device></root>";
    struct Case {
        const char *path;
        fakedev::Mode mode;
        std::string body;
    } cases[] = {
        {"/malformed.xml", fakedev::Mode::Normal, "<root><device><UDN>" + Uuid(2) + "</UDN><serv"},
        {"/deep.xml", fakedev::Mode::Normal, deep},
        {"/flat.xml", fakedev::Mode::Normal, flat},
        {"/stall.xml", fakedev::Mode::Stall, fakedev::DeviceDescription(Uuid(3), "s", "m", {})},
        {"/endless.xml", fakedev::Mode::Endless, "<root>"},
        {"/huge.xml", fakedev::Mode::Huge, "<root>"},
        {"/garbage.xml", fakedev::Mode::Garbage, ""},
        {"/close.xml", fakedev::Mode::Close, ""},
        {"/trickle.xml", fakedev::Mode::Trickle, fakedev::DeviceDescription(Uuid(4), "t", "m", {})},
        {"/notxml.xml", fakedev::Mode::Normal, std::string(5000, '\xff')},
    };
    for (const Case &k : cases) {
        fakedev::Route route;
        route.mode = k.mode;
        route.body = k.body;
        bad.SetRoute(k.path, route);
    }
    // A renderer whose service descriptions never finish.
    fakedev::Route slowDesc, stall;
    slowDesc.body = fakedev::DeviceDescription(Uuid(5), "slow", "m",
                                               {{kAvt, "AVTransport"}, {kRcs, "RenderingControl"}});
    stall.mode = fakedev::Mode::Stall;
    stall.body = Fixture("gmediarender_renderingcontrol_scpd.xml");
    bad.SetRoute("/slow.xml", slowDesc);
    bad.SetRoute("/RenderingControl/scpd.xml", stall);

    for (int round = 0; round < 3; ++round) {
        for (const Case &k : cases)
            fakedev::AnnounceService(daemonIp.c_str(), true, Uuid(9), kAvt, bad.BaseUrl() + k.path);
        fakedev::AnnounceService(daemonIp.c_str(), true, Uuid(5), kAvt, bad.BaseUrl() + "/slow.xml");
        fakedev::AnnounceService(daemonIp.c_str(), true, Uuid(6), kAvt, "http://");
        fakedev::AnnounceService(daemonIp.c_str(), true, Uuid(7), kAvt, std::string(3000, 'h'));
        // Garbage on the SSDP port and on libupnp's HTTP port.
        SendUdp("239.255.255.250", 1900, std::string("NOTIFY * HTTP/1.1\r\n\xff\xfe\r\n\r\n"),
                daemonIp.c_str());
        SendUdp("239.255.255.250", 1900, std::string(1400, 'A'), daemonIp.c_str());
        SendTcp(daemonIp, 49152, "NOTIFY / HTTP/1.1\r\nSID: uuid:x\r\nNT: upnp:event\r\n"
                                 "NTS: upnp:propchange\r\nSEQ: 0\r\nCONTENT-LENGTH: 99999999\r\n\r\n<a>");
        SendTcp(daemonIp, 49152, std::string(20000, '\x01'));
        std::this_thread::sleep_for(std::chrono::milliseconds(500));
    }

    // A well-behaved renderer is still found; its events go through.
    fakedev::FakeHttpServer good;
    ASSERT_GT(good.Start(daemonIp.c_str(), 0), 0);
    std::string goodUdn = Uuid(100);
    fakedev::Route desc, avt, rcs;
    desc.body = fakedev::DeviceDescription(goodUdn, "Good", "fake",
                                           {{kAvt, "AVTransport"}, {kRcs, "RenderingControl"}});
    avt.body = Fixture("gmediarender_avtransport_scpd.xml");
    rcs.body = Fixture("gmediarender_renderingcontrol_scpd.xml");
    good.SetRoute("/description.xml", desc);
    good.SetRoute("/AVTransport/scpd.xml", avt);
    good.SetRoute("/RenderingControl/scpd.xml", rcs);
    bool listed = false;
    for (int i = 0; i < 5 && !listed; ++i) {
        fakedev::AnnounceService(daemonIp.c_str(), true, goodUdn, kAvt,
                                 good.BaseUrl() + "/description.xml");
        listed = WaitUntil([&] { return RendererIndex(goodUdn) >= 0; }, 4000);
    }
    ASSERT_TRUE(listed) << h.Log();
    Json::Value entry = Renderers()["list"][RendererIndex(goodUdn)];
    EXPECT_TRUE(entry["seek"].asBool());
    EXPECT_TRUE(entry["set_volume"].asBool());

    // Bad LastChange events on its RenderingControl subscription.
    ASSERT_TRUE(good.WaitFor("SUBSCRIBE", "/RenderingControl/event", 1, 5000));
    fakedev::Request sub = good.RequestsOf("SUBSCRIBE", "/RenderingControl/event")[0];
    std::string callback = sub.Header("CALLBACK");
    std::string nested;
    for (int i = 0; i < 5000; ++i)
        nested += "<n>";
    std::string bodies[] = {
        fakedev::LastChangeEvent("<Event><Volume val=\"1\"></Event>"),
        fakedev::LastChangeEvent(nested),
        fakedev::LastChangeEvent(std::string(7000, '<')),
        "<e:propertyset xmlns:e=\"urn:schemas-upnp-org:event-1-0\"><e:property><LastChange>"
        "<Event/></LastChange></e:property></e:propertyset>",
        "not xml at all",
    };
    int seq = 0;
    for (const std::string &body : bodies)
        fakedev::SendGenaEvent(callback, sub.issuedSid, seq++, body);
    EXPECT_TRUE(h.WaitLog("Failed to parse LastChange, err=", 5000)) << h.Log();

    // The slow renderer is listed once its probe gives up; the others never.
    EXPECT_TRUE(WaitUntil([&] { return RendererIndex(Uuid(5)) >= 0; }, 30000));
    for (int n : {1, 2, 3, 4, 6, 7, 9})
        EXPECT_LT(RendererIndex(Uuid(n)), 0) << n;

    StopClient();
    EXPECT_GT(requests.load(), 20);
    EXPECT_EQ(0, unanswered.load()) << "of " << requests.load() << " requests";
    EXPECT_GT(h.PidFromFile(), 0);
    EXPECT_EQ(0, kill(h.Pid(), 0));

    // Stopped while a probe waits on a stalled service description: the
    // daemon still ends promptly.
    fakedev::Route lastDesc;
    lastDesc.body = fakedev::DeviceDescription(
        Uuid(8), "stalling", "m", {{kAvt, "AVTransport8"}, {kRcs, "RenderingControl8"}});
    bad.SetRoute("/last.xml", lastDesc);
    bad.SetRoute("/RenderingControl8/scpd.xml", stall);
    bool probing = false;
    for (int i = 0; i < 5 && !probing; ++i) {
        fakedev::AnnounceService(daemonIp.c_str(), true, Uuid(8), kAvt, bad.BaseUrl() + "/last.xml");
        probing = bad.WaitFor("GET", "/RenderingControl8/scpd.xml", 1, 3000);
    }
    EXPECT_TRUE(probing);
    auto t0 = std::chrono::steady_clock::now();
    EXPECT_EQ(0, h.Stop());
    double stopSeconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - t0).count();
    EXPECT_LT(stopSeconds, 5.0);
}

}  // namespace
