// The control point's list rules, answers and events, driven through the
// controller's callbacks with libupnp records built here and recorded
// descriptions of real devices. No libupnp start-up: nothing is sent.
#include <gtest/gtest.h>

#include <cstdlib>
#include <fstream>
#include <sstream>
#include <string>

#include "upnp/upnp.h"
#include "upnp/xml_util.h"

struct UpnpControllerAccess {
    static void AddServer(UpnpController &c, IXML_Document *d, const char *loc) { c.AddServer(d, loc); }
    static void AddRenderer(UpnpController &c, IXML_Document *d, const char *loc)
    {
        c.AddRenderer(d, loc);
    }
    static int OnByeBye(UpnpController &c, const UpnpDiscovery *e) { return c.OnByeBye(e); }
    static int RemoveRenderer(UpnpController &c, unsigned i) { return c.RemoveRenderer(i); }
    static int RemoveServer(UpnpController &c, unsigned i) { return c.RemoveServer(i); }
    static int OnActionComplete(UpnpController &c, const UpnpActionComplete *e)
    {
        return c.OnActionComplete(e);
    }
    static int OnSubscription(UpnpController &c, const UpnpEventSubscribe *e)
    {
        return c.OnSubscription(e);
    }
    static int OnEventReceived(UpnpController &c, const UpnpEvent *e) { return c.OnEventReceived(e); }
    static uint32_t Current(UpnpController &c) { return c.current; }
    static void SetCurrent(UpnpController &c, uint32_t v) { c.current = v; }
    static std::vector<RENDERER_INFO *> &Renderers(UpnpController &c) { return c.renderers; }
    static std::vector<SERVER_INFO *> &Servers(UpnpController &c) { return c.servers; }
};

namespace {

using A = UpnpControllerAccess;

const char kAvt[] = "urn:schemas-upnp-org:service:AVTransport:1";
const char kCds[] = "urn:schemas-upnp-org:service:ContentDirectory:1";

std::string Fixture(const char *name)
{
    std::ifstream in(std::string(TARN_SOURCE_DIR) + "/tests/fixtures/upnp/" + name);
    std::stringstream ss;
    ss << in.rdbuf();
    return ss.str();
}

IXML_Document *Parse(const std::string &text)
{
    IXML_Document *doc = nullptr;
    EXPECT_EQ(IXML_SUCCESS, ixmlParseBufferEx(text.c_str(), &doc)) << text.substr(0, 200);
    return doc;
}

// A media server description with the given UDN and name.
std::string ServerDescription(const std::string &udn, const std::string &name)
{
    return "<root xmlns=\"urn:schemas-upnp-org:device-1-0\"><device><friendlyName>" + name +
           "</friendlyName><UDN>" + udn +
           "</UDN><serviceList><service><serviceType>" + kCds +
           "</serviceType><controlURL>/ctl/ContentDir</controlURL></service>"
           "</serviceList></device></root>";
}

std::string Uuid(int n)
{
    char buf[64];
    snprintf(buf, sizeof(buf), "uuid:00000000-0000-0000-0000-%012d", n);
    return buf;  // 41 characters
}

void AddServer(UpnpController &c, const std::string &udn, const std::string &name,
               const char *location = "http://10.0.0.5:8200/rootDesc.xml")
{
    IXML_Document *doc = Parse(ServerDescription(udn, name));
    A::AddServer(c, doc, location);
    ixmlDocument_free(doc);
}

// A renderer description without services (no SCPD download is attempted
// beyond an empty URL), UDN given.
void AddRenderer(UpnpController &c, const std::string &udn, const std::string &name = "R",
                 const char *location = "http://127.0.0.1:1/d.xml")
{
    std::string xml = "<root><device><friendlyName>" + name + "</friendlyName><UDN>" + udn +
                      "</UDN><serviceList><service><serviceType>" + kAvt +
                      "</serviceType><controlURL>/avt/" + udn +
                      "</controlURL><eventSubURL>/avt/ev</eventSubURL><SCPDURL>/avt/scpd"
                      "</SCPDURL></service></serviceList></device></root>";
    IXML_Document *doc = Parse(xml);
    A::AddRenderer(c, doc, location);
    ixmlDocument_free(doc);
}

UpnpDiscovery *Discovery(const char *serviceType, const std::string &deviceId, int err = 0)
{
    UpnpDiscovery *d = UpnpDiscovery_new();
    UpnpDiscovery_set_ErrCode(d, err);
    UpnpDiscovery_strcpy_ServiceType(d, serviceType);
    UpnpDiscovery_strcpy_DeviceID(d, deviceId.c_str());
    return d;
}

// ---------------------------------------------------------------------------

TEST(UpnpUrl, LocationHostAndPort)
{
    std::string ip, port;
    ASSERT_EQ(0, UpnpController::ParseHttpUrl("http://10.0.0.5/desc.xml", ip, port));
    EXPECT_EQ("10.0.0.5", ip);
    EXPECT_EQ("80", port);
    ASSERT_EQ(0, UpnpController::ParseHttpUrl("http://10.0.0.5:49152/x", ip, port));
    EXPECT_EQ("10.0.0.5", ip);
    EXPECT_EQ("49152", port);
    ASSERT_EQ(0, UpnpController::ParseHttpUrl("http://10.0.0.5:8200", ip, port));
    EXPECT_EQ("8200", port);
    ASSERT_EQ(0, UpnpController::ParseHttpUrl("http://host", ip, port));
    EXPECT_EQ("host", ip);
    EXPECT_EQ("80", port);
    // The first ':' after the scheme counts even inside the path.
    ASSERT_EQ(0, UpnpController::ParseHttpUrl("http://10.0.0.5/a:b/c", ip, port));
    EXPECT_EQ("10.0.0.5/a", ip);
    EXPECT_EQ("b/c", port);
    EXPECT_EQ(-1, UpnpController::ParseHttpUrl("https://10.0.0.5/x", ip, port));
    EXPECT_EQ(-1, UpnpController::ParseHttpUrl("", ip, port));
}

TEST(UpnpUrl, ServiceUrlsResolveAgainstTheBase)
{
    EXPECT_EQ("http://10.0.0.5:80/ctl/x",
              UpnpController::ResolveUrl("http://10.0.0.5:80", "/ctl/x"));
    EXPECT_EQ("http://10.0.0.5:80/ctl/x", UpnpController::ResolveUrl("http://10.0.0.5:80", "ctl/x"));
    EXPECT_EQ("http://10.1.1.1:1/abs",
              UpnpController::ResolveUrl("http://10.0.0.5:80", "http://10.1.1.1:1/abs"));
}

TEST(UpnpServers, RecordedMediaServerIsListed)
{
    UpnpController c;
    IXML_Document *doc = Parse(Fixture("minidlna_description.xml"));
    A::AddServer(c, doc, "http://10.77.0.2:8200/rootDesc.xml");
    A::AddServer(c, doc, "http://10.77.0.2:8200/rootDesc.xml");  // again: listed once
    ixmlDocument_free(doc);
    ASSERT_EQ(1u, c.ServerCount());
    Json::Value reply;
    ASSERT_EQ(0, c.GetServerList(reply, 0, 0));
    const Json::Value &s = reply["list"][0];
    EXPECT_EQ("Test Server", s["friendly_name"].asString());
    EXPECT_EQ("uuid:4d696e69-444c-164e-9d41-b827eb0a1b2c", s["udn"].asString());
    EXPECT_EQ("10.77.0.2", s["ip"].asString());
    EXPECT_EQ("8200", s["port"].asString());
    EXPECT_EQ("http://10.77.0.2:8200/ctl/ContentDir", s["control_url"].asString());
    EXPECT_TRUE(s["index"].isInt());
    EXPECT_EQ(0, s["index"].asInt());
    EXPECT_EQ(1u, reply["total"].asUInt());
    EXPECT_FALSE(reply.isMember("current"));
    EXPECT_EQ(6u, s.size());
}

TEST(UpnpServers, UdnLengthAndLoopbackRules)
{
    UpnpController c;
    std::string u41 = Uuid(1);
    ASSERT_EQ(41u, u41.size());
    AddServer(c, u41.substr(0, 40), "forty");
    AddServer(c, u41 + "x", "forty-two");
    AddServer(c, Uuid(2), "loop", "http://127.0.0.1:8200/rootDesc.xml");
    AddServer(c, Uuid(3), "bad location", "ftp://10.0.0.5/x");
    EXPECT_EQ(0u, c.ServerCount());
    AddServer(c, u41, "ok");
    EXPECT_EQ(1u, c.ServerCount());
    // No service list: not listed; a service list without ContentDirectory: listed.
    IXML_Document *noServices = Parse("<root><device><UDN>" + Uuid(4) + "</UDN></device></root>");
    A::AddServer(c, noServices, "http://10.0.0.5/x");
    ixmlDocument_free(noServices);
    EXPECT_EQ(1u, c.ServerCount());
    IXML_Document *other = Parse("<root><device><UDN>" + Uuid(5) +
                                 "</UDN><serviceList><service><serviceType>urn:x</serviceType>"
                                 "</service></serviceList></device></root>");
    A::AddServer(c, other, "http://10.0.0.5/x");
    ixmlDocument_free(other);
    ASSERT_EQ(2u, c.ServerCount());
    Json::Value reply;
    c.GetServerList(reply, 0, 0);
    EXPECT_EQ("", reply["list"][0]["control_url"].asString());
    EXPECT_EQ("80", reply["list"][0]["port"].asString());
}

TEST(UpnpServers, SortedByNameCaseInsensitivelyNewestFirstAmongEquals)
{
    UpnpController c;
    AddServer(c, Uuid(1), "beta");
    AddServer(c, Uuid(2), "Alpha");
    AddServer(c, Uuid(3), "alpha");
    AddServer(c, Uuid(4), "Gamma");
    Json::Value reply;
    c.GetServerList(reply, 0, 0);
    ASSERT_EQ(4u, reply["list"].size());
    EXPECT_EQ("alpha", reply["list"][0]["friendly_name"].asString());
    EXPECT_EQ("Alpha", reply["list"][1]["friendly_name"].asString());
    EXPECT_EQ("beta", reply["list"][2]["friendly_name"].asString());
    EXPECT_EQ("Gamma", reply["list"][3]["friendly_name"].asString());
    for (int i = 0; i < 4; ++i)
        EXPECT_EQ(i, reply["list"][i]["index"].asInt());
}

TEST(UpnpServers, ByeByeRemovesOnlyForItsServiceType)
{
    UpnpController c;
    AddServer(c, Uuid(1), "one");
    AddServer(c, Uuid(2), "two");
    UpnpDiscovery *wrongType = Discovery(kAvt, Uuid(1));
    EXPECT_EQ(0, A::OnByeBye(c, wrongType));
    EXPECT_EQ(2u, c.ServerCount());
    UpnpDiscovery *failed = Discovery(kCds, Uuid(1), -1);
    EXPECT_EQ(-1, A::OnByeBye(c, failed));
    EXPECT_EQ(-1, A::OnByeBye(c, nullptr));
    UpnpDiscovery *bye = Discovery(kCds, Uuid(1));
    EXPECT_EQ(0, A::OnByeBye(c, bye));
    ASSERT_EQ(1u, c.ServerCount());
    EXPECT_EQ(Uuid(2), A::Servers(c)[0]->udn);
    EXPECT_EQ(-1, A::RemoveServer(c, 1));
    UpnpDiscovery_delete(wrongType);
    UpnpDiscovery_delete(failed);
    UpnpDiscovery_delete(bye);
}

TEST(UpnpRenderers, RecordedRendererUrlsAndNoDuplicates)
{
    UpnpController c;
    IXML_Document *doc = Parse(Fixture("gmediarender_description.xml"));
    // Nothing listens on port 1: the capability probe fails, the renderer
    // is listed all the same, capable of neither.
    A::AddRenderer(c, doc, "http://127.0.0.1:1/description.xml");
    A::AddRenderer(c, doc, "http://127.0.0.1:1/description.xml");
    ixmlDocument_free(doc);
    ASSERT_EQ(1u, c.RendererCount());
    RENDERER_INFO *r = nullptr;
    ASSERT_EQ(0, c.GetRenderer(0, &r));
    EXPECT_EQ("uuid:6a2c1f0e-3b7d-4c55-9e21-0a1b2c3d4e5f", r->udn);
    EXPECT_EQ("Test Renderer", r->friendly_name);
    EXPECT_EQ("http://127.0.0.1:1", r->base_url);
    EXPECT_EQ("http://127.0.0.1:1/upnp/control/rendertransport1", r->avt_control_url);
    EXPECT_EQ("http://127.0.0.1:1/upnp/event/rendertransport1", r->avt_event_url);
    EXPECT_EQ("http://127.0.0.1:1/upnp/rendertransportSCPD.xml", r->avt_scpd_url);
    EXPECT_EQ("http://127.0.0.1:1/upnp/control/rendercontrol1", r->rcs_control_url);
    EXPECT_EQ("http://127.0.0.1:1/upnp/event/rendercontrol1", r->rcs_event_url);
    EXPECT_EQ("http://127.0.0.1:1/upnp/rendercontrolSCPD.xml", r->rcs_scpd_url);
    EXPECT_EQ("http://127.0.0.1:1/upnp/control/renderconnmgr1", r->cms_control_url);
    EXPECT_EQ("http://127.0.0.1:1/upnp/event/renderconnmgr1", r->cms_event_url);
    EXPECT_EQ("http://127.0.0.1:1/upnp/renderconnmgrSCPD.xml", r->cms_scpd_url);
    EXPECT_FALSE(r->can_seek);
    EXPECT_FALSE(r->can_set_volume);
    EXPECT_EQ(0, r->duration);
    EXPECT_EQ(0, r->rel_time);
    EXPECT_EQ("", r->avt_sid);

    // Renderers take any UDN length (unlike servers).
    AddRenderer(c, "short");
    EXPECT_EQ(2u, c.RendererCount());
}

TEST(UpnpRenderers, ListReplyPagingAndTypes)
{
    UpnpController c;
    for (int i = 0; i < 3; ++i)
        AddRenderer(c, Uuid(i), "r" + std::to_string(i));
    Json::Value reply;
    ASSERT_EQ(0, c.GetRendererList(reply, 5, 10));
    EXPECT_TRUE(reply["list"].isArray());
    EXPECT_EQ(0u, reply["list"].size());
    EXPECT_EQ(5, reply["start"].asInt());
    EXPECT_EQ(3u, reply["total"].asUInt());

    reply = Json::Value();
    c.GetRendererList(reply, 0, -7);
    EXPECT_EQ(10, reply["limit"].asInt());
    EXPECT_EQ(3u, reply["list"].size());

    reply = Json::Value();
    c.GetRendererList(reply, 1, 0);  // no limit
    ASSERT_EQ(2u, reply["list"].size());
    EXPECT_EQ(1, reply["list"][0]["index"].asInt());
    EXPECT_EQ("r1", reply["list"][0]["friendly_name"].asString());

    reply = Json::Value();
    c.GetRendererList(reply, -3, 2);
    EXPECT_EQ(0, reply["start"].asInt());
    ASSERT_EQ(2u, reply["list"].size());

    reply = Json::Value();
    c.GetRendererList(reply, 1, 1);
    ASSERT_EQ(1u, reply["list"].size());
    EXPECT_EQ(1, reply["list"][0]["index"].asInt());

    // Key set and JSON types; -1 as the selection prints as 4294967295.
    const Json::Value &item = reply["list"][0];
    EXPECT_EQ(7u, item.size());
    EXPECT_TRUE(item["seek"].isBool());
    EXPECT_TRUE(item["set_volume"].isBool());
    EXPECT_TRUE(item["port"].isString());
    EXPECT_TRUE(item["index"].isInt());
    EXPECT_TRUE(reply["current"].isUInt());
    EXPECT_EQ(4294967295u, reply["current"].asUInt());
    Json::StyledWriter writer;
    EXPECT_NE(std::string::npos, writer.write(reply).find("\"current\" : 4294967295"));
}

TEST(UpnpRenderers, RemovalAdjustsTheSelection)
{
    struct Case {
        unsigned removed;
        uint32_t expected;
    } cases[] = {{1, static_cast<uint32_t>(-1)}, {0, 1}, {2, static_cast<uint32_t>(-1)}, {3, 2}};
    for (const Case &k : cases) {
        UpnpController c;
        for (int i = 0; i < 4; ++i)
            AddRenderer(c, Uuid(i));
        ASSERT_EQ(0, c.SelectRenderer(2));
        ASSERT_EQ(0, A::RemoveRenderer(c, k.removed));
        EXPECT_EQ(k.expected, A::Current(c)) << "removed " << k.removed;
        EXPECT_EQ(3u, c.RendererCount());
        EXPECT_EQ(-1, c.FindRendererByUdn(Uuid(static_cast<int>(k.removed))));
    }
    UpnpController c;
    AddRenderer(c, Uuid(0));
    EXPECT_EQ(-1, A::RemoveRenderer(c, 1));
    EXPECT_EQ(-1, c.SelectRenderer(1));  // index == count
    EXPECT_EQ(static_cast<uint32_t>(-1), A::Current(c));
    EXPECT_EQ(0, c.SelectRenderer(0));
    EXPECT_EQ(-1, c.SelectRenderer(1));
    EXPECT_EQ(0u, A::Current(c));  // unchanged by the failed selection

    // Bye-bye of the AVTransport service removes the renderer.
    UpnpDiscovery *bye = Discovery(kAvt, Uuid(0));
    EXPECT_EQ(0, A::OnByeBye(c, bye));
    UpnpDiscovery_delete(bye);
    EXPECT_EQ(0u, c.RendererCount());
    EXPECT_EQ(static_cast<uint32_t>(-1), A::Current(c));
}

TEST(UpnpRenderers, StateOfTheSelectedRenderer)
{
    UpnpController c;
    Json::Value reply;
    EXPECT_EQ(-1, c.GetRendererState(reply));
    EXPECT_TRUE(reply.isNull());
    AddRenderer(c, Uuid(0), "Kitchen");
    AddRenderer(c, Uuid(1), "Hall");
    ASSERT_EQ(0, c.SelectRenderer(1));
    RENDERER_INFO *r = A::Renderers(c)[1];
    r->current_uri = "http://x/1.mp3";
    r->duration = 245;
    r->rel_time = 12;
    r->transport_state = "PLAYING";
    r->volume = "42";
    r->mute = "0";
    ASSERT_EQ(0, c.GetRendererState(reply));
    EXPECT_EQ("http://x/1.mp3", reply["CurrentURI"].asString());
    EXPECT_EQ(245, reply["Duration"].asInt());
    EXPECT_EQ(12, reply["RelTime"].asInt());
    EXPECT_EQ("PLAYING", reply["TransportState"].asString());
    EXPECT_EQ(1u, reply["RendererIndex"].asUInt());
    EXPECT_EQ("Hall", reply["RendererFriendlyName"].asString());
    EXPECT_EQ("42", reply["Volume"].asString());
    EXPECT_EQ("0", reply["Mute"].asString());
    EXPECT_EQ(8u, reply.size());
}

TEST(UpnpRenderers, ClearListEmptiesOneKind)
{
    UpnpController c;
    AddRenderer(c, Uuid(0));
    AddServer(c, Uuid(1), "s");
    EXPECT_EQ(-1, c.ClearList("other"));
    EXPECT_EQ(0, c.ClearList("renderer"));
    EXPECT_EQ(0u, c.RendererCount());
    EXPECT_EQ(0u, A::Current(c));
    EXPECT_EQ(1u, c.ServerCount());
    EXPECT_EQ(0, c.ClearList("server"));
    EXPECT_EQ(0u, c.ServerCount());
}

// ---------------------------------------------------------------------------
// Action answers.

UpnpActionComplete *Answer(const std::string &ctrlUrl, int err, const char *result)
{
    UpnpActionComplete *a = UpnpActionComplete_new();
    UpnpActionComplete_set_ErrCode(a, err);
    UpnpActionComplete_strcpy_CtrlUrl(a, ctrlUrl.c_str());
    if (result != nullptr) {
        IXML_Document *doc = nullptr;
        EXPECT_EQ(IXML_SUCCESS, ixmlParseBufferEx(result, &doc));
        UpnpActionComplete_set_ActionResult(a, doc);
    }
    return a;
}

// The records do not own their documents.
void FreeAnswer(UpnpActionComplete *a)
{
    IXML_Document *doc = UpnpActionComplete_get_ActionResult(a);
    if (doc != nullptr)
        ixmlDocument_free(doc);
    UpnpActionComplete_delete(a);
}

const char kPositionAnswer[] =
    "<u:GetPositionInfoResponse xmlns:u=\"urn:schemas-upnp-org:service:AVTransport:1\">"
    "<Track>1</Track><TrackDuration>0:04:05</TrackDuration><TrackMetaData></TrackMetaData>"
    "<TrackURI>http://h/a.mp3</TrackURI><RelTime>0:01:02</RelTime><AbsTime>NOT_IMPLEMENTED"
    "</AbsTime></u:GetPositionInfoResponse>";

TEST(UpnpAnswers, PositionAndTransportInfo)
{
    UpnpController c;
    AddRenderer(c, Uuid(0));
    RENDERER_INFO *r = A::Renderers(c)[0];
    std::string url = r->avt_control_url;

    UpnpActionComplete *a = Answer(url, 0, kPositionAnswer);
    EXPECT_EQ(0, A::OnActionComplete(c, a));
    FreeAnswer(a);
    EXPECT_EQ(245, r->duration);
    EXPECT_EQ(62, r->rel_time);
    EXPECT_EQ("http://h/a.mp3", r->current_uri);

    // NOT_IMPLEMENTED duration: -1; an empty RelTime leaves the position.
    a = Answer(url, 0,
               "<m:GetPositionInfoResponse xmlns:m=\"urn:x\"><TrackDuration>NOT_IMPLEMENTED"
               "</TrackDuration><TrackURI></TrackURI><RelTime></RelTime></m:GetPositionInfoResponse>");
    EXPECT_EQ(0, A::OnActionComplete(c, a));
    FreeAnswer(a);
    EXPECT_EQ(-1, r->duration);
    EXPECT_EQ(62, r->rel_time);
    EXPECT_EQ("http://h/a.mp3", r->current_uri);

    // Another prefix is not recognised.
    a = Answer(url, 0,
               "<s:GetPositionInfoResponse xmlns:s=\"urn:x\"><TrackDuration>0:00:09</TrackDuration>"
               "<RelTime>0:00:01</RelTime></s:GetPositionInfoResponse>");
    EXPECT_EQ(0, A::OnActionComplete(c, a));
    FreeAnswer(a);
    EXPECT_EQ(-1, r->duration);
    EXPECT_EQ(62, r->rel_time);

    a = Answer(url, 0,
               "<u:GetTransportInfoResponse xmlns:u=\"urn:x\"><CurrentTransportState>"
               "PAUSED_PLAYBACK</CurrentTransportState><CurrentTransportStatus>OK"
               "</CurrentTransportStatus></u:GetTransportInfoResponse>");
    EXPECT_EQ(0, A::OnActionComplete(c, a));
    FreeAnswer(a);
    EXPECT_EQ("PAUSED_PLAYBACK", r->transport_state);

    // A SOAP fault still has its result searched; no result at all fails.
    a = Answer(url, 501,
               "<m:GetTransportInfoResponse xmlns:m=\"urn:x\"><CurrentTransportState>STOPPED"
               "</CurrentTransportState></m:GetTransportInfoResponse>");
    EXPECT_EQ(0, A::OnActionComplete(c, a));
    FreeAnswer(a);
    EXPECT_EQ("STOPPED", r->transport_state);
    a = Answer(url, 501, nullptr);
    EXPECT_EQ(-1, A::OnActionComplete(c, a));
    FreeAnswer(a);

    // Answers to other actions change nothing.
    a = Answer(url, 0, "<u:PlayResponse xmlns:u=\"urn:x\"></u:PlayResponse>");
    EXPECT_EQ(0, A::OnActionComplete(c, a));
    FreeAnswer(a);
    EXPECT_EQ(-1, A::OnActionComplete(c, nullptr));
}

TEST(UpnpAnswers, OnlyAVTransportAnswersOfListedRenderersCount)
{
    UpnpController c;
    IXML_Document *doc = Parse(Fixture("gmediarender_description.xml"));
    A::AddRenderer(c, doc, "http://127.0.0.1:1/description.xml");
    ixmlDocument_free(doc);
    RENDERER_INFO *r = A::Renderers(c)[0];

    // RenderingControl answer (even a volume-looking one) is dropped.
    UpnpActionComplete *a = Answer(r->rcs_control_url, 0, kPositionAnswer);
    EXPECT_EQ(-1, A::OnActionComplete(c, a));
    FreeAnswer(a);
    EXPECT_EQ(0, r->duration);
    a = Answer("http://elsewhere/ctl", 0, kPositionAnswer);
    EXPECT_EQ(-1, A::OnActionComplete(c, a));
    FreeAnswer(a);
    EXPECT_EQ(0, r->duration);
    // Connection failures of the RenderingControl do not remove it.
    a = Answer(r->rcs_control_url, UPNP_E_SOCKET_CONNECT, nullptr);
    EXPECT_EQ(-1, A::OnActionComplete(c, a));
    FreeAnswer(a);
    EXPECT_EQ(1u, c.RendererCount());
}

TEST(UpnpAnswers, RefusedConnectionRemovesTheRenderer)
{
    UpnpController c;
    for (int i = 0; i < 3; ++i)
        AddRenderer(c, Uuid(i));
    ASSERT_EQ(0, c.SelectRenderer(2));
    std::string url = A::Renderers(c)[1]->avt_control_url;
    // A result document that would update the record if it were used.
    UpnpActionComplete *a = Answer(url, UPNP_E_SOCKET_CONNECT, kPositionAnswer);
    EXPECT_EQ(-1, A::OnActionComplete(c, a));
    FreeAnswer(a);
    ASSERT_EQ(2u, c.RendererCount());
    EXPECT_EQ(-1, c.FindRendererByUdn(Uuid(1)));
    EXPECT_EQ(static_cast<uint32_t>(-1), A::Current(c));  // the one before the selection
    EXPECT_EQ(0, A::Renderers(c)[0]->duration);
    EXPECT_EQ(0, A::Renderers(c)[1]->duration);
}

TEST(UpnpActions, NothingIsSentWithoutASelectedRenderer)
{
    UpnpController c;
    AddRenderer(c, Uuid(0));
    // current is -1: every action fails.
    EXPECT_EQ(-1, c.Play());
    EXPECT_EQ(-1, c.Pause());
    EXPECT_EQ(-1, c.Stop());
    EXPECT_EQ(-1, c.GetPositionInfo());
    EXPECT_EQ(-1, c.GetTransportInfo());
    EXPECT_EQ(-1, c.SetVolume(3));
    EXPECT_EQ(-1, c.SetMute(1));
    EXPECT_EQ(-1, c.Seek(5));
    EXPECT_EQ(-1, c.SetAVTransportURI("http://h/a.mp3", ""));
    ASSERT_EQ(0, c.SelectRenderer(0));
    EXPECT_EQ(-1, c.SetAVTransportURI(nullptr, ""));
    EXPECT_EQ(-1, c.Seek(-1));
    const char *names[] = {"InstanceID"};
    const char *values[] = {"0"};
    EXPECT_EQ(-1, c.SendAction("Play", "urn:schemas-upnp-org:service:Other:1", names, values, 1));
    EXPECT_EQ(-1, c.SendAction(nullptr, kAvt, names, values, 1));
    EXPECT_EQ(-1, c.SendAction("Play", kAvt, nullptr, values, 1));
}

// ---------------------------------------------------------------------------
// Subscriptions and events.

UpnpEventSubscribe *Subscribed(const std::string &url, const char *sid, int err = 0)
{
    UpnpEventSubscribe *s = UpnpEventSubscribe_new();
    UpnpEventSubscribe_set_ErrCode(s, err);
    UpnpEventSubscribe_strcpy_PublisherUrl(s, url.c_str());
    UpnpEventSubscribe_strcpy_SID(s, sid);
    return s;
}

UpnpEvent *Event(const char *sid, const std::string &body)
{
    UpnpEvent *e = UpnpEvent_new();
    UpnpEvent_strcpy_SID(e, sid);
    IXML_Document *doc = nullptr;
    EXPECT_EQ(IXML_SUCCESS, ixmlParseBufferEx(body.c_str(), &doc));
    UpnpEvent_set_ChangedVariables(e, doc);
    return e;
}

void FreeEvent(UpnpEvent *e)
{
    IXML_Document *doc = UpnpEvent_get_ChangedVariables(e);
    if (doc != nullptr)
        ixmlDocument_free(doc);
    UpnpEvent_delete(e);
}

std::string LastChange(const std::string &inner)
{
    std::string esc = XmlEscape(inner);
    return "<e:propertyset xmlns:e=\"urn:schemas-upnp-org:event-1-0\"><e:property><LastChange>" +
           esc + "</LastChange></e:property></e:propertyset>";
}

class UpnpEvents : public ::testing::Test {
protected:
    void SetUp() override
    {
        IXML_Document *doc = Parse(Fixture("gmediarender_description.xml"));
        A::AddRenderer(c, doc, "http://127.0.0.1:1/description.xml");
        ixmlDocument_free(doc);
        r = A::Renderers(c)[0];
        UpnpEventSubscribe *s = Subscribed(r->avt_event_url, "uuid:avt-sid");
        A::OnSubscription(c, s);
        UpnpEventSubscribe_delete(s);
        s = Subscribed(r->rcs_event_url, "uuid:rcs-sid");
        A::OnSubscription(c, s);
        UpnpEventSubscribe_delete(s);
    }
    int Send(const char *sid, const std::string &body)
    {
        UpnpEvent *e = Event(sid, body);
        int rc = A::OnEventReceived(c, e);
        FreeEvent(e);
        return rc;
    }
    UpnpController c;
    RENDERER_INFO *r = nullptr;
};

TEST_F(UpnpEvents, SubscriptionIdsGoToTheirService)
{
    EXPECT_EQ("uuid:avt-sid", r->avt_sid);
    EXPECT_EQ("uuid:rcs-sid", r->rcs_sid);
    EXPECT_EQ("", r->cms_sid);
    UpnpEventSubscribe *s = Subscribed(r->cms_event_url, "uuid:cms-sid");
    A::OnSubscription(c, s);
    UpnpEventSubscribe_delete(s);
    EXPECT_EQ("uuid:cms-sid", r->cms_sid);
    // A failed subscription and an unknown publisher change nothing.
    s = Subscribed(r->avt_event_url, "uuid:other", UPNP_E_SUBSCRIBE_UNACCEPTED);
    A::OnSubscription(c, s);
    UpnpEventSubscribe_delete(s);
    s = Subscribed("http://elsewhere/ev", "uuid:other");
    A::OnSubscription(c, s);
    UpnpEventSubscribe_delete(s);
    EXPECT_EQ("uuid:avt-sid", r->avt_sid);
}

TEST_F(UpnpEvents, RecordedRendererEventsUpdateTheRecord)
{
    EXPECT_EQ(0, Send("uuid:rcs-sid", Fixture("gmediarender_renderingcontrol_event.xml")));
    EXPECT_EQ("100", r->volume);
    EXPECT_EQ("0", r->mute);
    r->duration = 77;
    EXPECT_EQ(0, Send("uuid:avt-sid", Fixture("gmediarender_avtransport_event.xml")));
    EXPECT_EQ(0, r->duration);          // "0:00:00"
    EXPECT_EQ("", r->current_uri);      // empty val leaves it
    EXPECT_EQ("", r->transport_state);  // never from events
}

TEST_F(UpnpEvents, LastChangeVariables)
{
    r->volume = "5";
    r->mute = "1";
    r->duration = 10;
    r->current_uri = "u";
    EXPECT_EQ(0, Send("uuid:rcs-sid",
                      LastChange("<Event><InstanceID val=\"0\"><Volume channel=\"Master\" val=\"42\"/>"
                                 "</InstanceID></Event>")));
    EXPECT_EQ("42", r->volume);
    EXPECT_EQ("1", r->mute);
    EXPECT_EQ(10, r->duration);
    EXPECT_EQ("u", r->current_uri);

    EXPECT_EQ(0, Send("uuid:avt-sid",
                      LastChange("<Event><InstanceID val=\"0\"><CurrentTrackDuration val=\"0:04:05\"/>"
                                 "<CurrentTrackURI val=\"http://h/b.mp3\"/><TransportState "
                                 "val=\"PLAYING\"/><RelativeTimePosition val=\"0:01:00\"/>"
                                 "</InstanceID></Event>")));
    EXPECT_EQ(245, r->duration);
    EXPECT_EQ("http://h/b.mp3", r->current_uri);
    EXPECT_EQ("", r->transport_state);
    EXPECT_EQ(0, r->rel_time);

    EXPECT_EQ(0, Send("uuid:avt-sid", LastChange("<Event><CurrentTrackDuration val=\"\"/></Event>")));
    EXPECT_EQ(245, r->duration);
    EXPECT_EQ(0, Send("uuid:avt-sid",
                      LastChange("<Event><CurrentTrackDuration val=\"NOT_IMPLEMENTED\"/></Event>")));
    EXPECT_EQ(-1, r->duration);

    // Only the first Volume counts, whatever its channel.
    EXPECT_EQ(0, Send("uuid:rcs-sid",
                      LastChange("<Event><Volume channel=\"LF\" val=\"7\"/><Volume channel=\"Master\" "
                                 "val=\"9\"/><Mute channel=\"Master\" val=\"1\"/></Event>")));
    EXPECT_EQ("7", r->volume);
    EXPECT_EQ("1", r->mute);

    // Prefixed elements are not recognised.
    EXPECT_EQ(0, Send("uuid:rcs-sid",
                      LastChange("<r:Event xmlns:r=\"urn:x\"><r:Volume val=\"99\"/></r:Event>")));
    EXPECT_EQ("7", r->volume);
}

TEST_F(UpnpEvents, UnknownSubscriptionsAndOtherVariablesChangeNothing)
{
    r->volume = "5";
    EXPECT_EQ(0, Send("uuid:nobody", LastChange("<Event><Volume val=\"42\"/></Event>")));
    EXPECT_EQ("5", r->volume);
    EXPECT_EQ(0, Send("uuid:rcs-sid",
                      "<e:propertyset xmlns:e=\"urn:schemas-upnp-org:event-1-0\"><e:property>"
                      "<Volume>42</Volume></e:property></e:propertyset>"));
    EXPECT_EQ("5", r->volume);
}

TEST_F(UpnpEvents, MalformedAndHostileLastChangeIsIgnored)
{
    r->volume = "5";
    const std::string bad[] = {
        "<Event><Volume val=\"42\"></Event>",  // not well-formed
        "",                                    // empty
        "just text",
        std::string(kXmlMaxDocumentBytes + 10, 'x'),
    };
    for (const std::string &text : bad)
        EXPECT_EQ(0, Send("uuid:rcs-sid", LastChange(text)));
    // Deeply nested, with a Volume inside: refused before parsing.
    std::string deep;
    for (int i = 0; i < 20000; ++i)
        deep += "<a>";
    deep += "<Volume val=\"42\"/>";
    for (int i = 0; i < 20000; ++i)
        deep += "</a>";
    EXPECT_EQ(0, Send("uuid:rcs-sid", LastChange(deep)));
    // Many siblings.
    std::string flat = "<Event>";
    for (int i = 0; i < 50000; ++i)
        flat += "<x/>";
    flat += "<Volume val=\"43\"/></Event>";
    EXPECT_EQ(0, Send("uuid:rcs-sid", LastChange(flat)));
    EXPECT_EQ("5", r->volume);
    // A LastChange whose first child is an element, not text.
    EXPECT_EQ(0, Send("uuid:rcs-sid",
                      "<e:propertyset xmlns:e=\"urn:schemas-upnp-org:event-1-0\"><e:property>"
                      "<LastChange><Event><Volume val=\"44\"/></Event></LastChange></e:property>"
                      "</e:propertyset>"));
    EXPECT_EQ("5", r->volume);
    // And the renderer still takes a good event.
    EXPECT_EQ(0, Send("uuid:rcs-sid", LastChange("<Event><Volume val=\"45\"/></Event>")));
    EXPECT_EQ("45", r->volume);
}

}  // namespace
