// The control point's list rules, action answers and events, driven through the
// controller's callbacks with libupnp records built here and events recorded
// from a real renderer (no libupnp start-up: nothing is sent); time texts and
// DIDL-Lite; the renderer player's song URLs and refusals; song-id tokens.
#include <gtest/gtest.h>

#include <sys/stat.h>

#include <cstring>
#include <fstream>
#include <iterator>
#include <string>

#include "platform/media_id.h"
#include "player/upnpplayer.h"
#include "tests/harness/harness.h"
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
    static void Push(UpnpController &c, const std::string &udn)
    {
        c.renderers.push_back(new RENDERER_INFO);
        c.renderers.back()->udn = udn;
    }
};

namespace {

tarntest::Harness g_h;  // private root and log file
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

TEST(UpnpServers, AdmissionSortingAndByeBye)
{
    UpnpController c;
    AddServer(c, Uuid(2), "loop", "http://127.0.0.1:8200/rootDesc.xml");
    AddServer(c, Uuid(3), "bad location", "ftp://10.0.0.5/x");
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
    // RenderingControl answers and failures, and unknown URLs, change nothing.
    EXPECT_EQ(-1, Answer(c, r->rcs_control_url, 0, kPosition));
    EXPECT_EQ(-1, Answer(c, r->rcs_control_url, UPNP_E_SOCKET_CONNECT, nullptr));
    EXPECT_EQ(-1, Answer(c, "http://elsewhere/ctl", 0, kPosition));
    EXPECT_EQ(245, r->duration);
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

TEST_F(UpnpEvents, RecordedCraftedAndMalformedLastChange)
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
    EXPECT_EQ("245 http://h/b.mp3 PLAYING 0", std::to_string(r->duration) + " " + r->current_uri + " " +
                                           r->transport_state + " " + std::to_string(r->rel_time));
    // Only the first Volume counts, whatever its channel; prefixed elements and
    // unknown subscriptions count not at all.
    EXPECT_EQ(0, Send("uuid:rcs-sid", LastChange("<Event><Volume channel=\"LF\" val=\"7\"/><Volume val=\"9\"/>"
                                                  "<Mute val=\"1\"/></Event>")));
    EXPECT_EQ("7 1", r->volume + " " + r->mute);
    EXPECT_EQ(0, Send("uuid:rcs-sid", LastChange("<r:Event xmlns:r=\"urn:x\"><r:Volume val=\"99\"/></r:Event>")));
    EXPECT_EQ(0, Send("uuid:nobody", LastChange("<Event><Volume val=\"42\"/></Event>")));
    EXPECT_EQ("7", r->volume);

    // Malformed texts change nothing.
    EXPECT_EQ(0, Send("uuid:rcs-sid", LastChange("<Event><Volume val=\"42\"></Event>")));
    EXPECT_EQ("7", r->volume);
    EXPECT_EQ(0, Send("uuid:rcs-sid", LastChange("<Event><Volume val=\"45\"/></Event>")));
    EXPECT_EQ("45", r->volume);
}

TEST(UpnpTimeText, ParseWriteAndRoundTrip)
{
    for (auto k : {std::make_pair("0:03:25.000", 205), {"01:02:05.5", 3725}, {"1:99:99", 9639},
                   {"-1:01:01", -3539}, {"00:03", -1}, {"", -1}, {"NOT_IMPLEMENTED", -1}})
        EXPECT_EQ(k.second, TimeStringToSeconds(k.first)) << k.first;
    EXPECT_EQ(-1, TimeStringToSeconds(nullptr));
    char buf[32], small[5];
    for (auto k : {std::make_pair(3725, "1:02:05.000"), {0, "0:00:00.000"}, {360000, "100:00:00.000"}}) {
        ASSERT_EQ(0, SecondsToTimeString(k.first, buf, sizeof(buf)));
        EXPECT_STREQ(k.second, buf);
        EXPECT_EQ(k.first, TimeStringToSeconds(buf));
    }
    EXPECT_EQ(-1, SecondsToTimeString(-1, buf, sizeof(buf)));
    EXPECT_EQ(-1, SecondsToTimeString(5, nullptr, 32));
    ASSERT_EQ(0, SecondsToTimeString(3725, small, sizeof(small)));  // cut, terminated
    EXPECT_STREQ("1:02", small);
}

TARN_MEDIA_INFO Song(const char *path, const char *title, const char *artist, float duration)
{
    TARN_MEDIA_INFO s;
    memset(&s, 0, sizeof(s));
    snprintf(s.path, sizeof(s.path), "%s", path);
    snprintf(s.title, sizeof(s.title), "%s", title);
    snprintf(s.artist, sizeof(s.artist), "%s", artist);
    snprintf(s.album, sizeof(s.album), "Album");
    snprintf(s.genre, sizeof(s.genre), "Rock");
    s.track = 7;
    s.duration = duration;
    return s;
}

TEST(UpnpDidl, ExactElementSequenceAndMimeTypes)
{
    TARN_MEDIA_INFO s = Song("/shares/Music/a.mp3", "Tom & Jerry's <Live>", "The \"Band\"", 245.9f);
    std::string out;
    ASSERT_EQ(0, BuildDidlMetadata(&s, "http://10.0.0.1/audio/x.cgi/ab.mp3?a=1&b=2", out));
    EXPECT_EQ("<DIDL-Lite xmlns=\"urn:schemas-upnp-org:metadata-1-0/DIDL-Lite/\" "
              "xmlns:dc=\"http://purl.org/dc/elements/1.1/\" "
              "xmlns:upnp=\"urn:schemas-upnp-org:metadata-1-0/upnp/\"><item>"
              "<dc:title>Tom &amp; Jerry&apos;s &lt;Live&gt;</dc:title>"
              "<dc:creator>The &quot;Band&quot;</dc:creator>"
              "<res duration=\"0:04:05.000\" protocolInfo=\"http-get:*:audio/mpeg:*\">"
              "http://10.0.0.1/audio/x.cgi/ab.mp3?a=1&b=2</res>"
              "<upnp:album>Album</upnp:album><upnp:artist>The &quot;Band&quot;</upnp:artist>"
              "<upnp:originalTrackNumber>7</upnp:originalTrackNumber><upnp:genre>Rock</upnp:genre>"
              "<upnp:class>object.item.audioItem.musicTrack</upnp:class></item></DIDL-Lite>",
              out);
    for (auto k : {std::make_pair("/m/noext", true), {"/m/a.xyz", true}, {"/m/A.FLAC", false}}) {
        TARN_MEDIA_INFO t = Song(k.first, "", "", 0.0f);
        ASSERT_EQ(0, BuildDidlMetadata(&t, "http://h/x", out));
        EXPECT_EQ(k.second, out.find("<res duration=\"0:00:00.000\" protocolInfo=\"http-get:*:text/plain:*\">") !=
                                std::string::npos) << k.first;
    }
    // Failures leave the output as it was.
    out = "kept";
    TARN_MEDIA_INFO negative = Song("/a.mp3", "t", "a", -3.0f);
    EXPECT_EQ(-1, BuildDidlMetadata(nullptr, "http://h/x", out));
    EXPECT_EQ(-1, BuildDidlMetadata(&negative, "http://h/x", out));
    EXPECT_EQ("kept", out);
}

class UpnpPlayerTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        g_h.WriteFile("/etc/tarninfo.conf", "admin_port=8080\nnet_card1_address=10.9.8.7\nusb_mount_root=/mnt/usb\n");
        UpnpControllerAccess::Push(controller, "uuid:renderer-0");
        ASSERT_EQ(0, controller.SelectRenderer(0));
        player.reset(new UpnpPlayer(&controller, 0));
        g_h.ClearLog();
    }
    UpnpController controller;
    std::unique_ptr<UpnpPlayer> player;
};

TEST_F(UpnpPlayerTest, SongUrlsForStreamsLibraryUsbAndByPathSongs)
{
    const std::string base = "http://10.9.8.7:8080/audio/webUI/audiotransfer.cgi/";
    const std::string token = MediaIDEncryption(5);
    struct {
        const char *conf, *path;  // conf "" keeps the one before
        std::string url;
    } cases[] = {
        {"", "HTTP://Radio.Example:8000/Live?a=1&b=2", "HTTP://Radio.Example:8000/Live?a=1&b=2"},
        {"", "/mnt/usb/a.mp3", base + "ipod/" + MediaPathToken("/mnt/usb/a.mp3") + ".mp3"},
        {"", "/mnt/usb/\x01\x0f.ogg", base + "ipod/" + MediaPathToken("/mnt/usb/\x01\x0f.ogg") + ".ogg"},
        {"", "/music/Artist/01 Song.FLAC", base + token + ".flac"},
        {"", "/music/notes.xyz", base + token + ".txt"},
        {"", "/mnt/usb2/a.mp3", base + token + ".mp3"},  // the USB root by whole components
        {"admin_port=8080\nnet_card1_address=10.9.8.7\nusb_mount_root=/\n", "/a", base + "ipod/" + MediaPathToken("/a") + ".txt"},
        {"net_card1_address=10.1.1.1\n", "/m/x.mp3", "http://10.1.1.1/audio/webUI/audiotransfer.cgi/" + token + ".mp3"},
    };
    std::string url;
    for (auto &c : cases) {
        if (*c.conf)
            g_h.WriteFile("/etc/tarninfo.conf", c.conf), player->ResolveHost();
        TARN_MEDIA_INFO info = tarntest::MakeMediaInfo(c.path, "", "");
        info.id = 5;
        ASSERT_EQ(0, player->BuildSongUrl(&info, url)) << c.path;
        EXPECT_EQ(c.url, url);
    }
    // A song queued by path has no library id: it goes by a path token.
    TARN_MEDIA_INFO byPath = tarntest::MakeMediaInfo("/m/x.mp3", "", "");
    byPath.id = 0;
    ASSERT_EQ(0, player->BuildSongUrl(&byPath, url));
    EXPECT_EQ("http://10.1.1.1/audio/webUI/audiotransfer.cgi/ipod/" + MediaPathToken("/m/x.mp3") + ".mp3", url);
    EXPECT_EQ(-1, player->BuildSongUrl(nullptr, url));
}

TEST_F(UpnpPlayerTest, ActionsOutsideThePlayerSetAreRefusedWithTheirCode)
{
    for (int code : {0, -3, 1, 14, 18, 29, 30, 31, 35, 36, 99}) {
        Json::Value reply;
        ControlRequest req = tarntest::MakeRequest(code, nullptr);
        EXPECT_EQ(-1, player->HandleAction(&req, reply)) << code;
        EXPECT_TRUE(reply.isNull()) << code;
        EXPECT_TRUE(0 < g_h.CountLog("upnpplayer:739 Action [" + std::to_string(code) + "] not handled")) << code;
    }
    Json::Value reply;
    EXPECT_EQ(-1, player->HandleAction(nullptr, reply));
    controller.Lock();  // free again after every refusal
    controller.Unlock();
}

TEST(SongToken, RoundTripsEveryIdAndRefusesAlteredTokens)
{
    std::set<std::string> seen;
    for (uint32_t id : {0u, 1u, 255u, 256u, 65535u, 123456789u, 0xFFFFFFFFu}) {
        std::string token = MediaIDEncryption(id);
        ASSERT_EQ(static_cast<size_t>(MEDIA_ID_TOKEN_LEN), token.size());
        EXPECT_TRUE(seen.insert(token).second) << "two ids share token " << token;
        uint32_t back = 0xdeadbeef;
        ASSERT_EQ(0, MediaIDDecryption(token.c_str(), &back));
        EXPECT_EQ(id, back);
    }
    std::string token = MediaIDEncryption(4242);
    std::vector<std::string> bad = {token.substr(1), token + "0", std::string(32, '0'), "zz" + token.substr(2)};
    for (size_t i = 0; i < token.size(); ++i)  // every single digit altered
        bad.push_back(token), bad.back()[i] = token[i] == '0' ? '1' : '0';
    uint32_t id = 0;
    for (const std::string &t : bad)
        EXPECT_EQ(-1, MediaIDDecryption(t.c_str(), &id)) << t;
    EXPECT_EQ(-1, MediaIDDecryption(nullptr, &id));
    // The secret is a private file of the installation.
    struct stat st;
    ASSERT_EQ(0, stat(g_h.Path("/usr/tarn/etc/media_id.key").c_str(), &st));
    EXPECT_EQ(0600, st.st_mode & 0777);
}

}  // namespace
