// The control point's list rules, action answers and events, driven through the
// controller's callbacks with libupnp records built here and events recorded
// from a real renderer (no libupnp start-up: nothing is sent); the renderer
// capability probe against a fake device on loopback.
#include <gtest/gtest.h>

#include <fstream>
#include <iterator>
#include <string>

#include "tests/tools/fakedevice/fake_device.h"
#include "upnp/get_capability.h"
#include "upnp/upnp.h"
#include "upnp/upnp_sdk.h"
#include "upnp/xml_util.h"

struct UpnpControllerAccess {
    static void AddServer(UpnpController &c, IXML_Document *d, const char *loc) { c.AddServer(d, loc); }
    static void AddRenderer(UpnpController &c, IXML_Document *d, const char *loc) { c.AddRenderer(d, loc); }
    static int OnByeBye(UpnpController &c, const UpnpDiscovery *e) { return c.OnByeBye(e); }
    static int RemoveRenderer(UpnpController &c, unsigned i) { return c.RemoveRenderer(i); }
    static int OnSubscription(UpnpController &c, const UpnpEventSubscribe *e) { return c.OnSubscription(e); }
    static int OnEventReceived(UpnpController &c, const UpnpEvent *e) { return c.OnEventReceived(e); }
    static uint32_t Current(UpnpController &c) { return c.current; }
    static RENDERER_INFO *Renderer(UpnpController &c, unsigned i) { return c.renderers[i]; }
};

namespace {

using A = UpnpControllerAccess;
const char kAvt[] = "urn:schemas-upnp-org:service:AVTransport:1";
const char kCds[] = "urn:schemas-upnp-org:service:ContentDirectory:1";
const uint32_t kNone = static_cast<uint32_t>(-1);

std::string Fixture(const char *name)
{
    std::ifstream in(std::string(TARN_SOURCE_DIR) + "/tests/fixtures/upnp/" + name);
    return std::string(std::istreambuf_iterator<char>(in), {});
}

IXML_Document *Parse(const std::string &text)
{
    IXML_Document *doc = nullptr;
    EXPECT_EQ(IXML_SUCCESS, ixmlParseBufferEx(text.c_str(), &doc)) << text.substr(0, 200);
    return doc;
}

std::string Uuid(int n)
{
    char buf[64];
    snprintf(buf, sizeof(buf), "uuid:00000000-0000-0000-0000-%012d", n);
    return buf;  // 41 characters
}

// Adds a device from its description text: a server (serviceType kCds) or a renderer.
void Add(UpnpController &c, bool server, const std::string &xml, const char *location)
{
    IXML_Document *doc = Parse(xml);
    (server ? A::AddServer : A::AddRenderer)(c, doc, location);
    ixmlDocument_free(doc);
}
void AddServer(UpnpController &c, const std::string &udn, const std::string &name,
               const char *location = "http://10.0.0.5:8200/rootDesc.xml")
{
    Add(c, true, "<root><device><friendlyName>" + name + "</friendlyName><UDN>" + udn +
                     "</UDN><serviceList><service><serviceType>" + kCds +
                     "</serviceType><controlURL>/ctl/ContentDir</controlURL></service></serviceList></device></root>",
        location);
}
// Nothing listens on port 1: the capability probe fails, the renderer is listed all the same.
void AddRenderer(UpnpController &c, const std::string &udn, const std::string &name = "R")
{
    std::string services;
    for (const char *s : {"AVTransport", "RenderingControl"})
        services += std::string("<service><serviceType>urn:schemas-upnp-org:service:") + s + ":1</serviceType>"
                    "<controlURL>/" + s + "/" + udn + "</controlURL><eventSubURL>ev/" + s + "/" + udn +
                    "</eventSubURL><SCPDURL>/" + s + ".xml</SCPDURL></service>";
    Add(c, false, "<root><device><friendlyName>" + name + "</friendlyName><UDN>" + udn + "</UDN><serviceList>" +
                      services + "</serviceList></device></root>", "http://127.0.0.1:1/d.xml");
}

int ByeBye(UpnpController &c, const char *type, const std::string &udn, int err = 0)
{
    UpnpDiscovery *d = UpnpDiscovery_new();
    UpnpDiscovery_set_ErrCode(d, err);
    UpnpDiscovery_strcpy_ServiceType(d, type);
    UpnpDiscovery_strcpy_DeviceID(d, udn.c_str());
    int rc = A::OnByeBye(c, d);
    UpnpDiscovery_delete(d);
    return rc;
}

TEST(UpnpUrl, LocationHostPortAndServiceUrls)
{
    struct { const char *url; int rc; const char *ip, *port; } cases[] = {
        {"http://10.0.0.5/desc.xml", 0, "10.0.0.5", "80"}, {"http://10.0.0.5:49152/x", 0, "10.0.0.5", "49152"},
        {"http://host", 0, "host", "80"}, {"http://10.0.0.5/a:b/c", 0, "10.0.0.5/a", "b/c"},
        {"https://10.0.0.5/x", -1, "", ""}, {"", -1, "", ""}};
    for (const auto &k : cases) {
        std::string ip, port;
        ASSERT_EQ(k.rc, UpnpController::ParseHttpUrl(k.url, ip, port)) << k.url;
        if (k.rc == 0) {
            EXPECT_EQ(std::string(k.ip) + " " + k.port, ip + " " + port) << k.url;
        }
    }
    EXPECT_EQ("http://10.0.0.5:80/ctl/x", UpnpController::ResolveUrl("http://10.0.0.5:80", "/ctl/x"));
    EXPECT_EQ("http://10.0.0.5:80/ctl/x", UpnpController::ResolveUrl("http://10.0.0.5:80", "ctl/x"));
    EXPECT_EQ("http://10.1.1.1:1/a", UpnpController::ResolveUrl("http://10.0.0.5:80", "http://10.1.1.1:1/a"));
}

TEST(UpnpServers, AdmissionSortingAndByeBye)
{
    UpnpController c;
    std::string u41 = Uuid(1);
    AddServer(c, u41.substr(0, 40), "forty");
    AddServer(c, u41 + "x", "forty-two");
    AddServer(c, Uuid(2), "loop", "http://127.0.0.1:8200/rootDesc.xml");
    AddServer(c, Uuid(3), "bad location", "ftp://10.0.0.5/x");
    Add(c, true, "<root><device><UDN>" + Uuid(4) + "</UDN></device></root>", "http://10.0.0.5/x");
    EXPECT_EQ(0u, c.ServerCount());
    for (auto k : {std::make_pair(1, "beta"), {2, "Alpha"}, {3, "alpha"}, {4, "Gamma"}})
        AddServer(c, Uuid(k.first), k.second);
    Json::Value reply;
    c.GetServerList(reply, 0, 0);
    std::string order;
    for (const Json::Value &s : reply["list"])
        order += s["friendly_name"].asString() + std::to_string(s["index"].asInt()) + " ";
    EXPECT_EQ("alpha0 Alpha1 beta2 Gamma3 ", order);  // case-insensitive, newest first among equals

    EXPECT_EQ(0, ByeBye(c, kAvt, Uuid(1)));  // another service type
    EXPECT_EQ(-1, ByeBye(c, kCds, Uuid(1), -1));
    EXPECT_EQ(-1, A::OnByeBye(c, nullptr));
    EXPECT_EQ(4u, c.ServerCount());
    EXPECT_EQ(0, ByeBye(c, kCds, Uuid(1)));
    EXPECT_EQ(3u, c.ServerCount());
    EXPECT_EQ(-1, c.FindServerByUdn(Uuid(1)));
}

TEST(UpnpRenderers, UrlsNoDuplicatesAndListReply)
{
    UpnpController c;
    AddRenderer(c, "short", "r0");  // any UDN length, unlike servers
    AddRenderer(c, "short", "r0");
    ASSERT_EQ(1u, c.RendererCount());
    RENDERER_INFO *r = A::Renderer(c, 0);
    EXPECT_EQ("http://127.0.0.1:1/AVTransport/short http://127.0.0.1:1/ev/RenderingControl/short "
              "http://127.0.0.1:1/RenderingControl.xml",
              r->avt_control_url + " " + r->rcs_event_url + " " + r->rcs_scpd_url);
    EXPECT_FALSE(r->can_seek || r->can_set_volume);
    AddRenderer(c, Uuid(1), "r1");
    AddRenderer(c, Uuid(2), "r2");

    struct { int start, limit; unsigned size; int first, replyLimit; } pages[] = {
        {5, 10, 0, -1, 10}, {0, -7, 3, 0, 10}, {1, 0, 2, 1, 0}, {-3, 2, 2, 0, 2}, {1, 1, 1, 1, 1}};
    for (const auto &k : pages) {
        Json::Value reply;
        ASSERT_EQ(0, c.GetRendererList(reply, k.start, k.limit));
        EXPECT_EQ(k.size, reply["list"].size()) << k.start << " " << k.limit;
        EXPECT_EQ(k.replyLimit, reply["limit"].asInt());
        EXPECT_EQ(3u, reply["total"].asUInt());
        if (k.first >= 0) {
            EXPECT_EQ(k.first, reply["list"][0]["index"].asInt());
        }
    }
    Json::Value reply;
    c.GetRendererList(reply, 0, 0);
    const Json::Value &item = reply["list"][0];
    EXPECT_EQ(7u, item.size());
    EXPECT_TRUE(item["seek"].isBool() && item["set_volume"].isBool() && item["port"].isString());
    EXPECT_NE(std::string::npos, Json::StyledWriter().write(reply).find("\"current\" : 4294967295"));
}

TEST(UpnpRenderers, RemovalAndSelection)
{
    struct { unsigned removed; uint32_t expected; } cases[] = {{1, kNone}, {0, 1}, {2, kNone}, {3, 2}};
    for (const auto &k : cases) {
        UpnpController c;
        for (int i = 0; i < 4; ++i)
            AddRenderer(c, Uuid(i));
        ASSERT_EQ(0, c.SelectRenderer(2));
        ASSERT_EQ(0, A::RemoveRenderer(c, k.removed));
        EXPECT_EQ(k.expected, A::Current(c)) << "removed " << k.removed;
        EXPECT_EQ(-1, c.FindRendererByUdn(Uuid(static_cast<int>(k.removed))));
    }
    UpnpController c;
    AddRenderer(c, Uuid(0));
    AddRenderer(c, Uuid(1));
    EXPECT_EQ(-1, c.Play());  // nothing selected: nothing is sent
    EXPECT_EQ(-1, A::RemoveRenderer(c, 2));
    EXPECT_EQ(0, c.SelectRenderer(1));
    EXPECT_EQ(-1, c.SelectRenderer(2));
    EXPECT_EQ(1u, A::Current(c));  // unchanged by the failed selection
    EXPECT_EQ(-1, c.Seek(-1));
    EXPECT_EQ(0, ByeBye(c, kAvt, Uuid(1)));  // the AVTransport bye-bye removes it
    EXPECT_EQ(1u, c.RendererCount());
    EXPECT_EQ(kNone, A::Current(c));
    EXPECT_EQ(-1, c.ClearList("other"));
    EXPECT_EQ(0, c.ClearList("renderer"));
    EXPECT_EQ(0u, c.RendererCount());
}

// An answer as libupnp's action job hands it over; the callback takes (and
// frees) both documents (libupnp before 1.14.16 does not; each poll leaked).
int Answer(UpnpController &c, const std::string &ctrlUrl, int err, const char *result)
{
    UpnpActionComplete *a = UpnpActionComplete_new();
    UpnpActionComplete_set_ErrCode(a, err);
    UpnpActionComplete_strcpy_CtrlUrl(a, ctrlUrl.c_str());
    UpnpActionComplete_set_ActionRequest(a, Parse("<u:GetPositionInfo xmlns:u=\"urn:x\"/>"));
    if (result != nullptr)
        UpnpActionComplete_set_ActionResult(a, Parse(result));
    int rc = UpnpController::OnUpnpEvent(UPNP_CONTROL_ACTION_COMPLETE, a, &c);
#if UPNP_VERSION < 11416
    EXPECT_EQ(nullptr, UpnpActionComplete_get_ActionRequest(a));
    EXPECT_EQ(nullptr, UpnpActionComplete_get_ActionResult(a));
#else
    ixmlDocument_free(UpnpActionComplete_get_ActionRequest(a));
    ixmlDocument_free(UpnpActionComplete_get_ActionResult(a));
#endif
    UpnpActionComplete_delete(a);
    return rc;
}

const char kPosition[] = "<u:GetPositionInfoResponse xmlns:u=\"urn:x\"><TrackDuration>0:04:05</TrackDuration>"
                         "<TrackURI>http://h/a.mp3</TrackURI><RelTime>0:01:02</RelTime></u:GetPositionInfoResponse>";

TEST(UpnpAnswers, AVTransportAnswersUpdateTheRecordAndRefusalsRemove)
{
    UpnpController c;
    for (int i = 0; i < 3; ++i)
        AddRenderer(c, Uuid(i));
    RENDERER_INFO *r = A::Renderer(c, 0);
    std::string url = r->avt_control_url;
    EXPECT_EQ(0, Answer(c, url, 0, kPosition));
    EXPECT_EQ("245 62 http://h/a.mp3", std::to_string(r->duration) + " " + std::to_string(r->rel_time) + " " + r->current_uri);
    // NOT_IMPLEMENTED duration: -1; empty texts and other prefixes leave the rest.
    EXPECT_EQ(0, Answer(c, url, 0, "<m:GetPositionInfoResponse xmlns:m=\"urn:x\"><TrackDuration>NOT_IMPLEMENTED"
                                   "</TrackDuration><TrackURI></TrackURI><RelTime></RelTime></m:GetPositionInfoResponse>"));
    EXPECT_EQ(0, Answer(c, url, 0, "<s:GetPositionInfoResponse xmlns:s=\"urn:x\"><RelTime>0:00:01</RelTime>"
                                   "</s:GetPositionInfoResponse>"));
    EXPECT_EQ("-1 62 http://h/a.mp3", std::to_string(r->duration) + " " + std::to_string(r->rel_time) + " " + r->current_uri);
    // A SOAP fault still has its result searched; no result at all fails.
    EXPECT_EQ(0, Answer(c, url, 501, "<u:GetTransportInfoResponse xmlns:u=\"urn:x\"><CurrentTransportState>"
                                     "PAUSED_PLAYBACK</CurrentTransportState></u:GetTransportInfoResponse>"));
    EXPECT_EQ("PAUSED_PLAYBACK", r->transport_state);
    EXPECT_EQ(-1, Answer(c, url, 501, nullptr));
    // RenderingControl answers and failures, and unknown URLs, change nothing.
    EXPECT_EQ(-1, Answer(c, r->rcs_control_url, 0, kPosition));
    EXPECT_EQ(-1, Answer(c, r->rcs_control_url, UPNP_E_SOCKET_CONNECT, nullptr));
    EXPECT_EQ(-1, Answer(c, "http://elsewhere/ctl", 0, kPosition));
    EXPECT_EQ(-1, r->duration);
    EXPECT_EQ(3u, c.RendererCount());
    // A refused AVTransport action removes its renderer; its result is not used.
    ASSERT_EQ(0, c.SelectRenderer(2));
    EXPECT_EQ(-1, Answer(c, A::Renderer(c, 1)->avt_control_url, UPNP_E_SOCKET_CONNECT, kPosition));
    EXPECT_EQ(2u, c.RendererCount());
    EXPECT_EQ(-1, c.FindRendererByUdn(Uuid(1)));
    EXPECT_EQ(kNone, A::Current(c));
    EXPECT_EQ(0, A::Renderer(c, 1)->duration);
}

class UpnpEvents : public ::testing::Test {
protected:
    void SetUp() override
    {
        AddRenderer(c, Uuid(0));
        r = A::Renderer(c, 0);
        Subscribe(r->avt_event_url, "uuid:avt-sid");
        Subscribe(r->rcs_event_url, "uuid:rcs-sid");
        Subscribe(r->avt_event_url, "uuid:other", UPNP_E_SUBSCRIBE_UNACCEPTED);
        Subscribe("http://elsewhere/ev", "uuid:other");
    }
    void Subscribe(const std::string &url, const char *sid, int err = 0)
    {
        UpnpEventSubscribe *s = UpnpEventSubscribe_new();
        UpnpEventSubscribe_set_ErrCode(s, err);
        UpnpEventSubscribe_strcpy_PublisherUrl(s, url.c_str());
        UpnpEventSubscribe_strcpy_SID(s, sid);
        A::OnSubscription(c, s);
        UpnpEventSubscribe_delete(s);
    }
    int Send(const char *sid, const std::string &body)
    {
        UpnpEvent *e = UpnpEvent_new();
        UpnpEvent_strcpy_SID(e, sid);
        IXML_Document *doc = Parse(body);
        UpnpEvent_set_ChangedVariables(e, doc);
        int rc = A::OnEventReceived(c, e);
        ixmlDocument_free(doc);
        UpnpEvent_delete(e);
        return rc;
    }
    static std::string LastChange(const std::string &inner)
    {
        return "<e:propertyset xmlns:e=\"urn:schemas-upnp-org:event-1-0\"><e:property><LastChange>" +
               XmlEscape(inner) + "</LastChange></e:property></e:propertyset>";
    }
    UpnpController c;
    RENDERER_INFO *r = nullptr;
};

TEST_F(UpnpEvents, RecordedCraftedAndHostileLastChange)
{
    EXPECT_EQ("uuid:avt-sid uuid:rcs-sid", r->avt_sid + " " + r->rcs_sid);
    EXPECT_EQ(0, Send("uuid:rcs-sid", Fixture("gmediarender_renderingcontrol_event.xml")));
    EXPECT_EQ("100 0", r->volume + " " + r->mute);
    r->duration = 77;
    EXPECT_EQ(0, Send("uuid:avt-sid", Fixture("gmediarender_avtransport_event.xml")));
    EXPECT_EQ(0, r->duration);       // "0:00:00"
    EXPECT_EQ("", r->current_uri);   // an empty val leaves it
    EXPECT_EQ(0, Send("uuid:avt-sid", LastChange("<Event><InstanceID val=\"0\"><CurrentTrackDuration val=\"0:04:05\"/>"
                                                  "<CurrentTrackURI val=\"http://h/b.mp3\"/><TransportState val=\"PLAYING\"/>"
                                                  "<RelativeTimePosition val=\"0:01:00\"/></InstanceID></Event>")));
    EXPECT_EQ("245 http://h/b.mp3  0", std::to_string(r->duration) + " " + r->current_uri + " " +
                                           r->transport_state + " " + std::to_string(r->rel_time));
    EXPECT_EQ(0, Send("uuid:avt-sid", LastChange("<Event><CurrentTrackDuration val=\"NOT_IMPLEMENTED\"/></Event>")));
    EXPECT_EQ(-1, r->duration);
    // Only the first Volume counts, whatever its channel; prefixed elements and
    // unknown subscriptions count not at all.
    EXPECT_EQ(0, Send("uuid:rcs-sid", LastChange("<Event><Volume channel=\"LF\" val=\"7\"/><Volume val=\"9\"/>"
                                                  "<Mute val=\"1\"/></Event>")));
    EXPECT_EQ("7 1", r->volume + " " + r->mute);
    EXPECT_EQ(0, Send("uuid:rcs-sid", LastChange("<r:Event xmlns:r=\"urn:x\"><r:Volume val=\"99\"/></r:Event>")));
    EXPECT_EQ(0, Send("uuid:nobody", LastChange("<Event><Volume val=\"42\"/></Event>")));
    EXPECT_EQ("7", r->volume);

    // Malformed, empty, deeply nested, crowded and oversized texts change nothing.
    std::string deep, flat = "<Event>";
    for (int i = 0; i < 20000; ++i)
        deep += "<a>";
    deep += "<Volume val=\"42\"/>";
    for (int i = 0; i < 20000; ++i)
        deep += "</a>";
    for (int i = 0; i < 50000; ++i)
        flat += "<x/>";
    flat += "<Volume val=\"43\"/></Event>";
    for (const std::string &text : {std::string("<Event><Volume val=\"42\"></Event>"), std::string(), deep, flat,
                                    std::string(kXmlMaxDocumentBytes + 10, 'x')})
        EXPECT_EQ(0, Send("uuid:rcs-sid", LastChange(text)));
    EXPECT_EQ(0, Send("uuid:rcs-sid", "<e:propertyset xmlns:e=\"urn:schemas-upnp-org:event-1-0\"><e:property>"
                                      "<LastChange><Event><Volume val=\"44\"/></Event></LastChange></e:property>"
                                      "</e:propertyset>"));  // an element, not text
    EXPECT_EQ("7", r->volume);
    EXPECT_EQ(0, Send("uuid:rcs-sid", LastChange("<Event><Volume val=\"45\"/></Event>")));
    EXPECT_EQ("45", r->volume);
}

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

TEST(UpnpCapability, ProbeDownloadsBothDescriptionsAndFailuresLeaveBothFalse)
{
    fakedev::FakeHttpServer device;
    ASSERT_GT(device.Start("127.0.0.1"), 0);
    device.SetRoute("/rcs.xml", {fakedev::RcsScpd()});
    device.SetRoute("/avt.xml", {fakedev::AvtScpd()});
    RENDERER_INFO renderer;
    renderer.rcs_scpd_url = device.BaseUrl() + "/rcs.xml";
    renderer.avt_scpd_url = device.BaseUrl() + "/avt.xml";
    Doc description(fakedev::DeviceDescription("uuid:x", "r", {}));
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
    EXPECT_EQ(-1, GetRendererCapability(nullptr, &renderer));
}

}  // namespace
