// The control point on a live libupnp inside the test's network namespace,
// against fake devices on the veth peer address: discovery from SSDP
// announcements, the SOAP actions as sent, subscriptions and events, removal
// by bye-bye and by refused connections, and devices that misbehave.
#include <gtest/gtest.h>

#include <chrono>
#include <fstream>
#include <functional>
#include <memory>
#include <sstream>
#include <string>
#include <thread>

#include "tests/tools/fakedevice/fake_device.h"
#include "upnp/upnp.h"
#include "upnp/xml_util.h"

// libupnp's asynchronous subscription job never frees its result record
// (UpnpEventSubscribe_new); leak checkers are told so, nothing else.
extern "C" const char *__lsan_default_suppressions()
{
    return "leak:UpnpEventSubscribe_new\n";
}

namespace {

// Fake devices serve and announce on the control point's own address: their
// multicast announcements reach it through the local loop (a copy crossing
// the veth pair carries a local source address and is dropped).
std::string g_deviceIp = "10.77.0.2";
const char kAvt[] = "urn:schemas-upnp-org:service:AVTransport:1";
const char kRcs[] = "urn:schemas-upnp-org:service:RenderingControl:1";
const char kCms[] = "urn:schemas-upnp-org:service:ConnectionManager:1";
const char kCds[] = "urn:schemas-upnp-org:service:ContentDirectory:1";

std::string Fixture(const char *name)
{
    std::ifstream in(std::string(TARN_SOURCE_DIR) + "/tests/fixtures/upnp/" + name);
    std::stringstream ss;
    ss << in.rdbuf();
    return ss.str();
}

bool InNamespace()
{
    char a[256] = {0}, b[256] = {0};
    ssize_t n1 = readlink("/proc/self/ns/net", a, sizeof(a) - 1);
    ssize_t n2 = readlink("/proc/1/ns/net", b, sizeof(b) - 1);
    if (n1 > 0 && n2 > 0)
        return strcmp(a, b) != 0;
    const char *flag = getenv("TARN_IN_NETNS");
    return flag != nullptr && strcmp(flag, "1") == 0;
}

bool WaitUntil(const std::function<bool()> &condition, int timeoutMs)
{
    auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeoutMs);
    while (std::chrono::steady_clock::now() < deadline) {
        if (condition())
            return true;
        std::this_thread::sleep_for(std::chrono::milliseconds(25));
    }
    return condition();
}

std::string Uuid(int n)
{
    char buf[64];
    snprintf(buf, sizeof(buf), "uuid:7e57c0de-0000-4000-8000-%012d", n);
    return buf;
}

// A renderer made of a fake HTTP server: description, the recorded service
// descriptions, SOAP answers and GENA subscriptions.
struct FakeRenderer {
    fakedev::FakeHttpServer http;
    std::string udn;
    std::string location;
    std::mutex mutex;
    std::string positionAnswer;

    int Start(const std::string &id, const std::string &name)
    {
        udn = id;
        if (http.Start(g_deviceIp.c_str(), 0) <= 0)
            return -1;
        location = http.BaseUrl() + "/description.xml";
        fakedev::Route desc, avt, rcs, cms;
        desc.body = fakedev::DeviceDescription(
            udn, name, "fake renderer",
            {{kAvt, "AVTransport"}, {kRcs, "RenderingControl"}, {kCms, "ConnectionManager"}});
        avt.body = Fixture("gmediarender_avtransport_scpd.xml");
        rcs.body = Fixture("gmediarender_renderingcontrol_scpd.xml");
        cms.body = "<scpd/>";
        http.SetRoute("/description.xml", desc);
        http.SetRoute("/AVTransport/scpd.xml", avt);
        http.SetRoute("/RenderingControl/scpd.xml", rcs);
        http.SetRoute("/ConnectionManager/scpd.xml", cms);
        http.SetSoapHandler([this](const fakedev::Request &req, int &status, std::string &body) {
            std::string action = req.Header("SOAPACTION");
            std::string name = action.substr(action.find('#') + 1);
            if (!name.empty() && name.back() == '"')
                name.pop_back();
            std::string inner;
            if (name == "GetPositionInfo") {
                std::lock_guard<std::mutex> lock(mutex);
                inner = positionAnswer;
            } else {
                inner = "<u:" + name + "Response xmlns:u=\"" + kAvt + "\"></u:" + name + "Response>";
            }
            status = 200;
            body = "<?xml version=\"1.0\"?><s:Envelope xmlns:s=\"http://schemas.xmlsoap.org/soap/"
                   "envelope/\" s:encodingStyle=\"http://schemas.xmlsoap.org/soap/encoding/\">"
                   "<s:Body>" +
                   inner + "</s:Body></s:Envelope>";
        });
        return 0;
    }
    int Announce(bool alive = true)
    {
        return fakedev::AnnounceService(g_deviceIp.c_str(), alive, udn, kAvt, location);
    }
};

class UpnpControlPoint : public ::testing::Test {
protected:
    static void SetUpTestSuite()
    {
        if (!InNamespace())
            return;
        controller = new UpnpController();
        initResult = controller->Init();
        const char *own = initResult == 0 ? UpnpGetServerIpAddress() : nullptr;
        if (own != nullptr && own[0] != '\0')
            g_deviceIp = own;
    }
    static void TearDownTestSuite()
    {
        if (controller != nullptr) {
            if (initResult == 0)
                controller->Uninit();
            delete controller;
            controller = nullptr;
        }
    }
    void SetUp() override
    {
        if (!InNamespace())
            GTEST_SKIP() << "needs a private network namespace (run under scripts/netns-run)";
        ASSERT_EQ(0, initResult);
    }

    template <class F>
    static auto Locked(F f) -> decltype(f())
    {
        controller->Lock();
        auto result = f();
        controller->Unlock();
        return result;
    }
    static int RendererIndex(const std::string &udn)
    {
        return Locked([&] { return controller->FindRendererByUdn(udn); });
    }
    static int ServerIndex(const std::string &udn)
    {
        return Locked([&] { return controller->FindServerByUdn(udn); });
    }
    // A copy of the renderer's record (empty udn when not listed).
    static RENDERER_INFO Renderer(const std::string &udn)
    {
        return Locked([&] {
            RENDERER_INFO copy;
            int i = controller->FindRendererByUdn(udn);
            RENDERER_INFO *r = nullptr;
            if (i >= 0 && controller->GetRenderer(static_cast<unsigned>(i), &r) == 0)
                copy = *r;
            return copy;
        });
    }
    // Announces until the renderer is listed (SSDP is UDP).
    static bool AnnounceUntilListed(FakeRenderer &device)
    {
        for (int attempt = 0; attempt < 5; ++attempt) {
            device.Announce();
            if (WaitUntil([&] { return RendererIndex(device.udn) >= 0; }, 3000))
                return true;
        }
        return false;
    }
    // Runs one action with the renderer selected, under the lock, the way
    // the main loop does.
    static int Act(const std::string &udn, const std::function<int()> &action)
    {
        return Locked([&] {
            int i = controller->FindRendererByUdn(udn);
            if (i < 0 || controller->SelectRenderer(static_cast<unsigned>(i)) != 0)
                return -2;
            return action();
        });
    }

    static UpnpController *controller;
    static int initResult;
};

UpnpController *UpnpControlPoint::controller = nullptr;
int UpnpControlPoint::initResult = -1;

std::string Between(const std::string &text, const std::string &open, const std::string &close)
{
    size_t a = text.find(open);
    if (a == std::string::npos)
        return "<none>";
    a += open.size();
    size_t b = text.find(close, a);
    return b == std::string::npos ? "<none>" : text.substr(a, b - a);
}

TEST_F(UpnpControlPoint, AnnouncedRendererIsListedProbedAndSubscribed)
{
    FakeRenderer device;
    ASSERT_EQ(0, device.Start(Uuid(1), "Living Room"));
    ASSERT_TRUE(AnnounceUntilListed(device));
    RENDERER_INFO r = Renderer(device.udn);
    EXPECT_EQ("Living Room", r.friendly_name);
    EXPECT_EQ(g_deviceIp, r.ip);
    EXPECT_EQ(std::to_string(device.http.Port()), r.port);
    EXPECT_EQ(device.http.BaseUrl() + "/AVTransport/control", r.avt_control_url);
    EXPECT_TRUE(r.can_seek);
    EXPECT_TRUE(r.can_set_volume);

    // AVTransport and RenderingControl subscribed, ConnectionManager not.
    EXPECT_TRUE(device.http.WaitFor("SUBSCRIBE", "/AVTransport/event", 1, 5000));
    EXPECT_TRUE(device.http.WaitFor("SUBSCRIBE", "/RenderingControl/event", 1, 5000));
    EXPECT_TRUE(WaitUntil([&] {
        RENDERER_INFO x = Renderer(device.udn);
        return !x.avt_sid.empty() && !x.rcs_sid.empty();
    }, 5000));
    EXPECT_TRUE(device.http.RequestsOf("SUBSCRIBE", "/ConnectionManager/event").empty());

    // Announced again: listed once, not probed again.
    size_t gets = device.http.RequestsOf("GET", "/AVTransport/scpd.xml").size();
    device.Announce();
    std::this_thread::sleep_for(std::chrono::milliseconds(500));
    Json::Value reply;
    Locked([&] { return controller->GetRendererList(reply, 0, 0); });
    int listed = 0;
    for (const Json::Value &item : reply["list"])
        listed += item["udn"].asString() == device.udn;
    EXPECT_EQ(1, listed);
    EXPECT_EQ(gets, device.http.RequestsOf("GET", "/AVTransport/scpd.xml").size());

    // Bye-bye removes it.
    device.Announce(false);
    EXPECT_TRUE(WaitUntil([&] { return RendererIndex(device.udn) < 0; }, 5000));
}

TEST_F(UpnpControlPoint, ActionsAsSentAndTheirAnswers)
{
    FakeRenderer device;
    ASSERT_EQ(0, device.Start(Uuid(2), "Kitchen"));
    ASSERT_TRUE(AnnounceUntilListed(device));

    std::string didl = "<DIDL-Lite><item><dc:title>A &amp; B</dc:title></item></DIDL-Lite>";
    EXPECT_EQ(0, Act(device.udn, [&] {
        return controller->SetAVTransportURI("http://10.77.0.1/a.cgi/x.mp3?a=1&b=2", didl.c_str());
    }));
    EXPECT_EQ(0, Act(device.udn, [] { return controller->Seek(3725); }));
    EXPECT_EQ(0, Act(device.udn, [] { return controller->SetVolume(35); }));
    EXPECT_EQ(0, Act(device.udn, [] { return controller->SetMute(1); }));
    EXPECT_EQ(0, Act(device.udn, [] { return controller->Play(); }));
    EXPECT_EQ(-1, Act(device.udn, [] { return controller->Seek(-1); }));

    ASSERT_TRUE(device.http.WaitFor("POST", "/AVTransport/control", 3, 5000));
    ASSERT_TRUE(device.http.WaitFor("POST", "/RenderingControl/control", 2, 5000));
    std::map<std::string, fakedev::Request> byAction;
    for (const fakedev::Request &req : device.http.RequestsOf("POST")) {
        std::string a = req.Header("SOAPACTION");
        byAction[a.substr(a.find('#') + 1, a.size() - a.find('#') - 2)] = req;
    }
    ASSERT_EQ(5u, byAction.size());
    const fakedev::Request &seek = byAction["Seek"];
    EXPECT_EQ("\"urn:schemas-upnp-org:service:AVTransport:1#Seek\"", seek.Header("SOAPACTION"));
    EXPECT_EQ("0", Between(seek.body, "<InstanceID>", "</InstanceID>"));
    EXPECT_EQ("REL_TIME", Between(seek.body, "<Unit>", "</Unit>"));
    EXPECT_EQ("1:02:05.000", Between(seek.body, "<Target>", "</Target>"));
    EXPECT_EQ("/RenderingControl/control", byAction["SetVolume"].path);
    EXPECT_EQ("Master", Between(byAction["SetVolume"].body, "<Channel>", "</Channel>"));
    EXPECT_EQ("35", Between(byAction["SetVolume"].body, "<DesiredVolume>", "</DesiredVolume>"));
    EXPECT_EQ("1", Between(byAction["SetMute"].body, "<DesiredMute>", "</DesiredMute>"));
    EXPECT_EQ("1", Between(byAction["Play"].body, "<Speed>", "</Speed>"));
    const std::string &set = byAction["SetAVTransportURI"].body;
    EXPECT_EQ("http://10.77.0.1/a.cgi/x.mp3?a=1&amp;b=2", Between(set, "<CurrentURI>", "</CurrentURI>"));
    // The metadata travels escaped once more inside the action.
    EXPECT_EQ("&lt;DIDL-Lite&gt;&lt;item&gt;&lt;dc:title&gt;A &amp;amp; B&lt;/dc:title&gt;"
              "&lt;/item&gt;&lt;/DIDL-Lite&gt;",
              Between(set, "<CurrentURIMetaData>", "</CurrentURIMetaData>"));
    // Argument order as declared.
    EXPECT_LT(set.find("<InstanceID>"), set.find("<CurrentURI>"));
    EXPECT_LT(set.find("<CurrentURI>"), set.find("<CurrentURIMetaData>"));

    // Answers land in the record.
    {
        std::lock_guard<std::mutex> lock(device.mutex);
        device.positionAnswer = std::string("<u:GetPositionInfoResponse xmlns:u=\"") + kAvt +
                                "\"><Track>1</Track><TrackDuration>0:04:05</TrackDuration>"
                                "<TrackURI>http://10.77.0.1/x.mp3</TrackURI><RelTime>0:00:42"
                                "</RelTime></u:GetPositionInfoResponse>";
    }
    EXPECT_EQ(0, Act(device.udn, [] { return controller->GetPositionInfo(); }));
    EXPECT_TRUE(WaitUntil([&] { return Renderer(device.udn).duration == 245; }, 5000));
    RENDERER_INFO r = Renderer(device.udn);
    EXPECT_EQ(42, r.rel_time);
    EXPECT_EQ("http://10.77.0.1/x.mp3", r.current_uri);
}

TEST_F(UpnpControlPoint, EventsUpdateTheRendererAndBadOnesAreDropped)
{
    FakeRenderer device;
    ASSERT_EQ(0, device.Start(Uuid(3), "Study"));
    ASSERT_TRUE(AnnounceUntilListed(device));
    ASSERT_TRUE(WaitUntil([&] { return !Renderer(device.udn).rcs_sid.empty(); }, 5000));
    std::vector<fakedev::Request> subs = device.http.RequestsOf("SUBSCRIBE", "/RenderingControl/event");
    ASSERT_FALSE(subs.empty());
    std::string callback = subs[0].Header("CALLBACK");
    // The device's own subscription ID (libupnp reports its own one to the
    // control point).
    std::string sid = subs[0].issuedSid;

    int seq = 0;
    auto send = [&](const std::string &lastChange) {
        return fakedev::SendGenaEvent(callback, sid, seq++, fakedev::LastChangeEvent(lastChange));
    };
    EXPECT_EQ(200, send("<Event xmlns=\"urn:schemas-upnp-org:metadata-1-0/RCS/\"><InstanceID val=\"0\">"
                        "<Volume channel=\"Master\" val=\"42\"/><Mute channel=\"Master\" val=\"1\"/>"
                        "</InstanceID></Event>"));
    ASSERT_TRUE(WaitUntil([&] { return Renderer(device.udn).volume == "42"; }, 5000));
    EXPECT_EQ("1", Renderer(device.udn).mute);

    // Malformed, deeply nested and oversized LastChange texts.
    std::string deep;
    for (int i = 0; i < 3000; ++i)
        deep += "<a>";
    deep += "<Volume val=\"7\"/>";
    for (int i = 0; i < 3000; ++i)
        deep += "</a>";
    send("<Event><Volume val=\"7\"></Event>");
    send(deep);
    send(std::string(30000, '<'));
    send("<Event><Volume val=\"8\"/></Event>");
    ASSERT_TRUE(WaitUntil([&] { return Renderer(device.udn).volume == "8"; }, 5000));
}

TEST_F(UpnpControlPoint, RendererThatRefusesConnectionsLeavesOnItsNextAction)
{
    FakeRenderer device;
    ASSERT_EQ(0, device.Start(Uuid(4), "Garage"));
    ASSERT_TRUE(AnnounceUntilListed(device));
    // A failing RenderingControl action does not remove it.
    device.http.Stop();
    EXPECT_EQ(0, Act(device.udn, [] { return controller->SetVolume(3); }));
    std::this_thread::sleep_for(std::chrono::milliseconds(500));
    EXPECT_GE(RendererIndex(device.udn), 0);
    EXPECT_EQ(0, Act(device.udn, [] { return controller->GetTransportInfo(); }));
    EXPECT_TRUE(WaitUntil([&] { return RendererIndex(device.udn) < 0; }, 10000));
    uint32_t current = Locked([] {
        Json::Value reply;
        controller->GetRendererList(reply, 0, 0);
        return reply["current"].asUInt();
    });
    EXPECT_EQ(4294967295u, current);
}

TEST_F(UpnpControlPoint, MediaServerByAnnouncementAndByeBye)
{
    fakedev::FakeHttpServer http;
    ASSERT_GT(http.Start(g_deviceIp.c_str(), 0), 0);
    fakedev::Route desc;
    desc.body = Fixture("minidlna_description.xml");
    http.SetRoute("/rootDesc.xml", desc);
    std::string udn = "uuid:4d696e69-444c-164e-9d41-b827eb0a1b2c";
    std::string location = http.BaseUrl() + "/rootDesc.xml";
    bool listed = false;
    for (int i = 0; i < 5 && !listed; ++i) {
        fakedev::AnnounceService(g_deviceIp.c_str(), true, udn, kCds, location);
        listed = WaitUntil([&] { return ServerIndex(udn) >= 0; }, 3000);
    }
    ASSERT_TRUE(listed);
    Json::Value reply;
    Locked([&] { return controller->GetServerList(reply, 0, 0); });
    const Json::Value &s = reply["list"][ServerIndex(udn)];
    EXPECT_EQ("Test Server", s["friendly_name"].asString());
    EXPECT_EQ(http.BaseUrl() + "/ctl/ContentDir", s["control_url"].asString());
    // A bye-bye for another service type of the same device changes nothing.
    fakedev::AnnounceService(g_deviceIp.c_str(), false, udn, kCms, location);
    std::this_thread::sleep_for(std::chrono::milliseconds(500));
    EXPECT_GE(ServerIndex(udn), 0);
    fakedev::AnnounceService(g_deviceIp.c_str(), false, udn, kCds, location);
    EXPECT_TRUE(WaitUntil([&] { return ServerIndex(udn) < 0; }, 5000));
}

TEST_F(UpnpControlPoint, HostileDevicesNeitherCrashNorBlock)
{
    fakedev::FakeHttpServer http;
    ASSERT_GT(http.Start(g_deviceIp.c_str(), 0), 0);
    std::string deep;
    for (int i = 0; i < 100000; ++i)
        deep += "<a>";
    std::string flat = "<root><device><UDN>" + Uuid(90) + "</UDN>";
    for (int i = 0; i < 60000; ++i)
        flat += "<x/>";
    flat += "</device></root>";
    std::string longUrl = fakedev::DeviceDescription(
        Uuid(91), "long", "m", {{kAvt, std::string(20000, 'A')}});
    struct Case {
        const char *path;
        fakedev::Mode mode;
        std::string body;
    } cases[] = {
        {"/malformed.xml", fakedev::Mode::Normal, "<root><device><UDN>" + Uuid(92) + "</UDN>"},
        {"/deep.xml", fakedev::Mode::Normal, deep},
        {"/flat.xml", fakedev::Mode::Normal, flat},
        {"/stall.xml", fakedev::Mode::Stall, fakedev::DeviceDescription(Uuid(93), "s", "m", {})},
        {"/endless.xml", fakedev::Mode::Endless, "<root>"},
        {"/huge.xml", fakedev::Mode::Huge, "<root>"},
        {"/garbage.xml", fakedev::Mode::Garbage, ""},
        {"/close.xml", fakedev::Mode::Close, ""},
        {"/longurl.xml", fakedev::Mode::Normal, longUrl},
    };
    for (const Case &k : cases) {
        fakedev::Route route;
        route.mode = k.mode;
        route.body = k.body;
        http.SetRoute(k.path, route);
        fakedev::AnnounceService(g_deviceIp.c_str(), true, Uuid(99), kAvt, http.BaseUrl() + k.path);
    }
    // A renderer whose service descriptions never finish.
    fakedev::Route slowDesc, stall;
    slowDesc.body = fakedev::DeviceDescription(Uuid(94), "slow", "m",
                                               {{kAvt, "AVTransport"}, {kRcs, "RenderingControl"}});
    stall.mode = fakedev::Mode::Stall;
    stall.body = Fixture("gmediarender_renderingcontrol_scpd.xml");
    http.SetRoute("/slow.xml", slowDesc);
    http.SetRoute("/RenderingControl/scpd.xml", stall);
    fakedev::AnnounceService(g_deviceIp.c_str(), true, Uuid(94), kAvt, http.BaseUrl() + "/slow.xml");
    // Announcements with broken locations.
    fakedev::AnnounceService(g_deviceIp.c_str(), true, Uuid(95), kAvt, "http://");
    fakedev::AnnounceService(g_deviceIp.c_str(), true, Uuid(96), kAvt, "no url at all");
    fakedev::AnnounceService(g_deviceIp.c_str(), true, Uuid(97), kAvt, "http://" + g_deviceIp + ":1/refused.xml");

    // Meanwhile the lock stays available: the main loop is never held up.
    auto until = std::chrono::steady_clock::now() + std::chrono::seconds(3);
    double worst = 0;
    while (std::chrono::steady_clock::now() < until) {
        auto t0 = std::chrono::steady_clock::now();
        Json::Value reply;
        Locked([&] { return controller->GetRendererList(reply, 0, 0); });
        worst = std::max(worst, std::chrono::duration<double>(std::chrono::steady_clock::now() - t0).count());
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
    EXPECT_LT(worst, 1.0) << "the controller's lock was held for " << worst << " s";

    // A well-behaved renderer announced now is still found.
    FakeRenderer good;
    ASSERT_EQ(0, good.Start(Uuid(98), "Good"));
    EXPECT_TRUE(AnnounceUntilListed(good));
    // The slow one is listed once its probe gives up, capable of neither.
    EXPECT_TRUE(WaitUntil([&] { return RendererIndex(Uuid(94)) >= 0; }, 20000));
    RENDERER_INFO slow = Renderer(Uuid(94));
    EXPECT_FALSE(slow.can_seek);
    EXPECT_FALSE(slow.can_set_volume);
    for (int n : {90, 92, 93, 95, 96, 97, 99})
        EXPECT_LT(RendererIndex(Uuid(n)), 0) << n;
    // Very long service URLs are kept as they are.
    EXPECT_TRUE(WaitUntil([&] { return RendererIndex(Uuid(91)) >= 0; }, 10000));
    EXPECT_GT(Renderer(Uuid(91)).avt_control_url.size(), 20000u);
}

}  // namespace
