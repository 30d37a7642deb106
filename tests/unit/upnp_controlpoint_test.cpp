// The capability probe and the bounded description download against a fake
// device on loopback, and the control point on a live libupnp inside the
// test's network namespace: discovery, the SOAP actions as sent, their
// answers, subscriptions and events.
#include <gtest/gtest.h>

#include <chrono>
#include <functional>
#include <map>
#include <string>
#include <thread>

#include "tests/harness/harness.h"
#include "tests/tools/fakedevice/fake_device.h"
#include "upnp/get_capability.h"
#include "upnp/upnp.h"
#include "upnp/xml_util.h"

// libupnp's asynchronous subscription job never frees its result record
// (UpnpEventSubscribe_new); leak checkers are told so, nothing else.
extern "C" const char *__lsan_default_suppressions() { return "leak:UpnpEventSubscribe_new\n"; }

namespace {

const char kAvt[] = "urn:schemas-upnp-org:service:AVTransport:1";
const char kRcs[] = "urn:schemas-upnp-org:service:RenderingControl:1";
const char kCms[] = "urn:schemas-upnp-org:service:ConnectionManager:1";

struct Doc {
    IXML_Document *doc = nullptr;
    explicit Doc(const std::string &text) { EXPECT_EQ(IXML_SUCCESS, ixmlParseBufferEx(text.c_str(), &doc)); }
    ~Doc() { ixmlDocument_free(doc); }
};

std::string Replace(std::string text, const std::string &from, const std::string &to)
{
    size_t pos = text.find(from);
    EXPECT_NE(std::string::npos, pos) << from;
    return pos == std::string::npos ? text : text.replace(pos, from.size(), to);
}

bool WaitUntil(const std::function<bool()> &condition, int timeoutMs)
{
    for (int waited = 0; !condition(); waited += 25) {
        if (waited >= timeoutMs)
            return false;
        std::this_thread::sleep_for(std::chrono::milliseconds(25));
    }
    return true;
}

TEST(UpnpCapability, SeekNeedsRelTimeAndVolumeNeedsSetVolume)
{
    std::string avt = fakedev::AvtScpd(), rcs = fakedev::RcsScpd();
    struct { std::string text; bool seek, volume; } cases[] = {
        {avt, true, false}, {rcs, false, true},
        {Replace(avt, "<allowedValue>REL_TIME</allowedValue>", ""), false, false},
        {Replace(avt, "<name>Seek</name>", "<name>Seek2</name>"), false, false},
        {Replace(avt, "<name>A_ARG_TYPE_SeekMode</name>", "<name>A_ARG_TYPE_Other</name>"), false, false},
        {Replace(rcs, "<name>SetVolume</name>", "<name>SetVolumeX</name>"), false, false},
        {"<s:scpd xmlns:s=\"urn:x\"><s:actionList><s:action><s:name>SetVolume</s:name></s:action>"
         "</s:actionList></s:scpd>", false, false}};  // prefixed names are not recognised
    for (const auto &k : cases) {
        Doc d(k.text);
        EXPECT_EQ(k.seek, SupportsRelTimeSeek(d.doc)) << k.text;
        EXPECT_EQ(k.volume, SupportsSetVolume(d.doc)) << k.text;
    }
    EXPECT_FALSE(SupportsRelTimeSeek(nullptr) || SupportsSetVolume(nullptr));
}

class UpnpProbe : public ::testing::Test {
protected:
    void SetUp() override
    {
        ASSERT_GT(device.Start("127.0.0.1", 0), 0);
        renderer.rcs_scpd_url = device.BaseUrl() + "/rcs.xml";
        renderer.avt_scpd_url = device.BaseUrl() + "/avt.xml";
        device.SetRoute("/rcs.xml", {fakedev::RcsScpd()});
        device.SetRoute("/avt.xml", {fakedev::AvtScpd()});
    }
    int Download(const std::string &path, double *seconds = nullptr)
    {
        IXML_Document *doc = nullptr;
        auto start = std::chrono::steady_clock::now();
        int rc = XmlDownloadDoc((device.BaseUrl() + path).c_str(), &doc);
        if (seconds != nullptr)
            *seconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
        EXPECT_EQ(rc == UPNP_E_SUCCESS, doc != nullptr) << path;
        ixmlDocument_free(doc);
        return rc;
    }
    fakedev::FakeHttpServer device;
    RENDERER_INFO renderer;
    Doc description{fakedev::DeviceDescription("uuid:x", "r", {})};
};

TEST_F(UpnpProbe, BothDescriptionsDecideAndFailuresLeaveBothFalse)
{
    ASSERT_EQ(0, GetRendererCapability(description.doc, &renderer));
    EXPECT_TRUE(renderer.can_seek && renderer.can_set_volume);
    EXPECT_EQ(1u, device.RequestsOf("GET", "/avt.xml").size());
    // A known limited model is capable of neither and downloads nothing.
    Doc limited(Replace(fakedev::DeviceDescription("uuid:x", "r", {}), "<modelName>fake</modelName>",
                        "<modelName>WD TV HD Live</modelName>"));
    ASSERT_EQ(0, GetRendererCapability(limited.doc, &renderer));
    EXPECT_FALSE(renderer.can_seek || renderer.can_set_volume);
    EXPECT_EQ(1u, device.RequestsOf("GET", "/avt.xml").size());
    // A broken AVTransport description; a missing RenderingControl one stops
    // the probe before the AVTransport download.
    device.SetRoute("/avt.xml", {"<scpd><actionList><action><name>Seek</name>"});
    EXPECT_EQ(-1, GetRendererCapability(description.doc, &renderer));
    EXPECT_FALSE(renderer.can_seek || renderer.can_set_volume);
    renderer.rcs_scpd_url = device.BaseUrl() + "/missing.xml";
    EXPECT_EQ(-1, GetRendererCapability(description.doc, &renderer));
    EXPECT_EQ(2u, device.RequestsOf("GET", "/avt.xml").size());
    for (const char *url : {"http://127.0.0.1:1/rcs.xml", ""}) {
        renderer.rcs_scpd_url = url;
        EXPECT_EQ(-1, GetRendererCapability(description.doc, &renderer)) << url;
    }
    EXPECT_EQ(-1, GetRendererCapability(nullptr, &renderer));
    EXPECT_EQ(-1, GetRendererCapability(description.doc, nullptr));
}

TEST_F(UpnpProbe, HostileAnswersFailInBoundedTimeAndShutdownCancels)
{
    std::string deep;
    for (int i = 0; i < 30000; ++i)
        deep += "<a>";
    std::string full = fakedev::AvtScpd();
    struct { fakedev::Mode mode; std::string body; } cases[] = {
        {fakedev::Mode::Stall, full}, {fakedev::Mode::Endless, "<scpd>"}, {fakedev::Mode::Huge, "<scpd>"},
        {fakedev::Mode::Close, ""}, {fakedev::Mode::Garbage, "<scpd/>"}, {fakedev::Mode::Normal, deep},
        {fakedev::Mode::Normal, std::string("\0\1\2<\xff>", 6)}};
    for (const auto &k : cases) {
        device.SetRoute("/hostile.xml", {k.body, k.mode});
        double seconds = 0;
        EXPECT_NE(UPNP_E_SUCCESS, Download("/hostile.xml", &seconds)) << static_cast<int>(k.mode);
        EXPECT_LT(seconds, 20.0) << static_cast<int>(k.mode);
    }
    // A download waiting on a stalled answer ends when downloads are aborted.
    int rc = 0;
    double seconds = 0;
    device.SetRoute("/hostile.xml", {full, fakedev::Mode::Stall});
    std::thread downloader([&] { rc = Download("/hostile.xml", &seconds); });
    ASSERT_TRUE(device.WaitFor("GET", "/hostile.xml", 8, 5000));
    XmlAbortDownloads(true);
    downloader.join();
    XmlAbortDownloads(false);
    EXPECT_EQ(UPNP_E_CANCELED, rc);
    EXPECT_LT(seconds, 5.0);  // the download alone would wait 10 s
    EXPECT_EQ(UPNP_E_SUCCESS, Download("/rcs.xml"));
}

// Runs one action with the renderer selected, under the lock, as the main loop does.
int Act(UpnpController &c, const std::string &udn, const std::function<int()> &action)
{
    c.Lock();
    int i = c.FindRendererByUdn(udn);
    int rc = i < 0 || c.SelectRenderer(static_cast<unsigned>(i)) != 0 ? -2 : action();
    c.Unlock();
    return rc;
}
RENDERER_INFO Copy(UpnpController &c, const std::string &udn)
{
    RENDERER_INFO copy, *r = nullptr;
    c.Lock();
    int i = c.FindRendererByUdn(udn);
    if (i >= 0 && c.GetRenderer(static_cast<unsigned>(i), &r) == 0)
        copy = *r;
    c.Unlock();
    return copy;
}
std::string Between(const std::string &text, const std::string &open, const std::string &close)
{
    size_t a = text.find(open), b = a == std::string::npos ? a : text.find(close, a + open.size());
    return b == std::string::npos ? "<none>" : text.substr(a + open.size(), b - a - open.size());
}

TEST(UpnpControlPoint, AnnouncedRendererIsProbedDrivenAndEvented)
{
    if (!tarntest::InPrivateNetns())
        GTEST_SKIP() << "needs a private network namespace (run under scripts/netns-run)";
    UpnpController c;
    ASSERT_EQ(0, c.Init());
    // The device serves and announces on the control point's own address: the
    // announcement reaches it through the local multicast loop.
    std::string ip = UpnpGetServerIpAddress(), udn = "uuid:7e57c0de-0000-4000-8000-000000000001";
    fakedev::FakeHttpServer http;
    ASSERT_GT(http.Start(ip.c_str(), 0), 0);
    http.SetRoute("/description.xml", {fakedev::DeviceDescription(udn, "Kitchen", {{kAvt, "AVTransport"},
                                       {kRcs, "RenderingControl"}, {kCms, "ConnectionManager"}})});
    http.SetRoute("/AVTransport/scpd.xml", {fakedev::AvtScpd()});
    http.SetRoute("/RenderingControl/scpd.xml", {fakedev::RcsScpd()});
    http.SetRoute("/ConnectionManager/scpd.xml", {"<scpd/>"});
    std::string position = "<u:GetPositionInfoResponse xmlns:u=\"" + std::string(kAvt) + "\"><TrackDuration>"
                           "0:04:05</TrackDuration><TrackURI>http://10.77.0.1/x.mp3</TrackURI><RelTime>0:00:42"
                           "</RelTime></u:GetPositionInfoResponse>";
    http.SetSoapHandler([&](const fakedev::Request &req, std::string &body) {
        std::string name = Between(req.Header("SOAPACTION"), "#", "\"");
        body = "<?xml version=\"1.0\"?><s:Envelope xmlns:s=\"http://schemas.xmlsoap.org/soap/envelope/\" "
               "s:encodingStyle=\"http://schemas.xmlsoap.org/soap/encoding/\"><s:Body>" +
               (name == "GetPositionInfo" ? position : "<u:" + name + "Response xmlns:u=\"" + kAvt + "\"/>") +
               "</s:Body></s:Envelope>";
    });
    bool listed = false;
    for (int i = 0; i < 5 && !listed; ++i) {
        fakedev::AnnounceService(ip.c_str(), true, udn, kAvt, http.BaseUrl() + "/description.xml");
        listed = WaitUntil([&] { return !Copy(c, udn).udn.empty(); }, 3000);
    }
    ASSERT_TRUE(listed);
    RENDERER_INFO r = Copy(c, udn);
    EXPECT_EQ("Kitchen " + ip + " " + std::to_string(http.Port()), r.friendly_name + " " + r.ip + " " + r.port);
    EXPECT_EQ(http.BaseUrl() + "/AVTransport/control", r.avt_control_url);
    EXPECT_TRUE(r.can_seek && r.can_set_volume);
    // AVTransport and RenderingControl are subscribed, ConnectionManager not.
    EXPECT_TRUE(WaitUntil([&] { r = Copy(c, udn); return !r.avt_sid.empty() && !r.rcs_sid.empty(); }, 5000));
    EXPECT_TRUE(http.RequestsOf("SUBSCRIBE", "/ConnectionManager/event").empty());

    std::string didl = "<DIDL-Lite><item><dc:title>A &amp; B</dc:title></item></DIDL-Lite>";
    EXPECT_EQ(0, Act(c, udn, [&] { return c.SetAVTransportURI("http://10.77.0.1/a.cgi/x.mp3?a=1&b=2", didl.c_str()); }));
    EXPECT_EQ(0, Act(c, udn, [&] { return c.Seek(3725); }));
    EXPECT_EQ(0, Act(c, udn, [&] { return c.SetVolume(35); }));
    EXPECT_EQ(0, Act(c, udn, [&] { return c.SetMute(1); }));
    EXPECT_EQ(0, Act(c, udn, [&] { return c.Play(); }));
    ASSERT_TRUE(http.WaitFor("POST", "/AVTransport/control", 3, 5000));
    ASSERT_TRUE(http.WaitFor("POST", "/RenderingControl/control", 2, 5000));
    std::map<std::string, fakedev::Request> sent;
    for (const fakedev::Request &req : http.RequestsOf("POST"))
        sent[Between(req.Header("SOAPACTION"), "#", "\"")] = req;
    ASSERT_EQ(5u, sent.size());
    const std::string &seek = sent["Seek"].body, &set = sent["SetAVTransportURI"].body;
    EXPECT_EQ("\"urn:schemas-upnp-org:service:AVTransport:1#Seek\"", sent["Seek"].Header("SOAPACTION"));
    EXPECT_EQ("0 REL_TIME 1:02:05.000", Between(seek, "<InstanceID>", "</InstanceID>") + " " +
                                            Between(seek, "<Unit>", "</Unit>") + " " + Between(seek, "<Target>", "</Target>"));
    EXPECT_EQ("/RenderingControl/control", sent["SetVolume"].path);
    EXPECT_EQ("Master 35", Between(sent["SetVolume"].body, "<Channel>", "</Channel>") + " " +
                               Between(sent["SetVolume"].body, "<DesiredVolume>", "</DesiredVolume>"));
    EXPECT_EQ("1", Between(sent["SetMute"].body, "<DesiredMute>", "</DesiredMute>"));
    EXPECT_EQ("1", Between(sent["Play"].body, "<Speed>", "</Speed>"));
    EXPECT_EQ("http://10.77.0.1/a.cgi/x.mp3?a=1&amp;b=2", Between(set, "<CurrentURI>", "</CurrentURI>"));
    // The metadata travels escaped once more, the arguments in their declared order.
    EXPECT_EQ("&lt;DIDL-Lite&gt;&lt;item&gt;&lt;dc:title&gt;A &amp;amp; B&lt;/dc:title&gt;&lt;/item&gt;"
              "&lt;/DIDL-Lite&gt;", Between(set, "<CurrentURIMetaData>", "</CurrentURIMetaData>"));
    EXPECT_LT(set.find("<InstanceID>"), set.find("<CurrentURI>"));
    EXPECT_LT(set.find("<CurrentURI>"), set.find("<CurrentURIMetaData>"));
    // The answer lands in the record.
    EXPECT_EQ(0, Act(c, udn, [&] { return c.GetPositionInfo(); }));
    EXPECT_TRUE(WaitUntil([&] { return Copy(c, udn).duration == 245; }, 5000));
    EXPECT_EQ(42, Copy(c, udn).rel_time);
    EXPECT_EQ("http://10.77.0.1/x.mp3", Copy(c, udn).current_uri);

    // Events on the device's own subscription ID; bad LastChange texts are dropped.
    fakedev::Request sub = http.RequestsOf("SUBSCRIBE", "/RenderingControl/event").at(0);
    int seq = 0;
    auto send = [&](const std::string &lastChange) {
        return fakedev::SendGenaEvent(sub.Header("CALLBACK"), sub.issuedSid, seq++, fakedev::LastChangeEvent(lastChange));
    };
    EXPECT_EQ(200, send("<Event><InstanceID val=\"0\"><Volume channel=\"Master\" val=\"42\"/><Mute val=\"1\"/>"
                        "</InstanceID></Event>"));
    EXPECT_TRUE(WaitUntil([&] { return Copy(c, udn).volume == "42"; }, 5000));
    EXPECT_EQ("1", Copy(c, udn).mute);
    send("<Event><Volume val=\"7\"></Event>");
    send(std::string(30000, '<'));
    send("<Event><Volume val=\"8\"/></Event>");
    EXPECT_TRUE(WaitUntil([&] { return Copy(c, udn).volume == "8"; }, 5000));

    fakedev::AnnounceService(ip.c_str(), false, udn, kAvt, "");
    EXPECT_TRUE(WaitUntil([&] { return Copy(c, udn).udn.empty(); }, 5000));
    EXPECT_EQ(0, c.Uninit());
}

}  // namespace
