// Fuzz target: the XML text helpers and everything the control point does
// with XML that other machines send: renderer events (LastChange), action
// answers (GetPositionInfo, GetTransportInfo, GetVolume, GetMute) and device
// descriptions.
//
// Byte 0 of the input chooses the use of the rest:
//   0  the text as an event's property set, sent with the AVTransport SID
//   1  the text escaped into a LastChange property (AVTransport SID)
//   2  the same with the RenderingControl SID
//   3  the text as the answer to an AVTransport action
//   4  the text as the answer to a RenderingControl action
//   5  the text as a renderer's device description (probe against a closed
//      loopback port, then the renderer is removed again)
// Every use first goes through the size and depth guard and the helpers.
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

#include "fuzz/fuzz_root.h"
#include "upnp/upnp.h"
#include "upnp/xml_util.h"

// Access to the controller's callbacks, as the unit tests have it.
struct UpnpControllerAccess {
    static void AddRenderer(UpnpController &c, IXML_Document *d, const char *loc)
    {
        c.AddRenderer(d, loc);
    }
    static int RemoveRenderer(UpnpController &c, unsigned i) { return c.RemoveRenderer(i); }
    static int OnActionComplete(UpnpController &c, const UpnpActionComplete *e)
    {
        return c.OnActionComplete(e);
    }
    static int OnSubscription(UpnpController &c, const UpnpEventSubscribe *e)
    {
        return c.OnSubscription(e);
    }
    static int OnEventReceived(UpnpController &c, const UpnpEvent *e) { return c.OnEventReceived(e); }
    static std::vector<RENDERER_INFO *> &Renderers(UpnpController &c) { return c.renderers; }
};

namespace {

using A = UpnpControllerAccess;

const char kDescription[] =
    "<?xml version=\"1.0\"?><root xmlns=\"urn:schemas-upnp-org:device-1-0\"><device>"
    "<deviceType>urn:schemas-upnp-org:device:MediaRenderer:1</deviceType>"
    "<friendlyName>Fuzz renderer</friendlyName><UDN>uuid:fuzz-renderer</UDN><serviceList>"
    "<service><serviceType>urn:schemas-upnp-org:service:AVTransport:1</serviceType>"
    "<controlURL>/avt/ctl</controlURL><eventSubURL>/avt/evt</eventSubURL>"
    "<SCPDURL>/avt.xml</SCPDURL></service>"
    "<service><serviceType>urn:schemas-upnp-org:service:RenderingControl:1</serviceType>"
    "<controlURL>/rcs/ctl</controlURL><eventSubURL>/rcs/evt</eventSubURL>"
    "<SCPDURL>/rcs.xml</SCPDURL></service></serviceList></device></root>";

UpnpController *g_controller = nullptr;
RENDERER_INFO *g_renderer = nullptr;

void Subscribe(const std::string &url, const char *sid)
{
    UpnpEventSubscribe *s = UpnpEventSubscribe_new();
    UpnpEventSubscribe_set_ErrCode(s, 0);
    UpnpEventSubscribe_strcpy_PublisherUrl(s, url.c_str());
    UpnpEventSubscribe_strcpy_SID(s, sid);
    A::OnSubscription(*g_controller, s);
    UpnpEventSubscribe_delete(s);
}

void Helpers(IXML_Document *doc)
{
    static const char *tags[] = {"TransportState", "Volume", "Mute", "RelTime", "TrackDuration",
                                 "InstanceID", "LastChange", "UDN", "service", "CurrentVolume"};
    for (const char *tag : tags) {
        std::string text = XmlGetDocElementText(doc, tag);
        std::string val = XmlGetDocElementVal(doc, tag);
        IXML_Element *e = XmlGetDocElement(doc, tag);
        if (e != nullptr) {
            XmlGetElementChildText(e, "serviceType");
            XmlFindItemByChildText(e, "service", "serviceType", text.c_str());
            XmlHasChildWithText(e, "allowedValue", val.c_str());
        }
        TimeStringToSeconds(text.c_str());
        std::string esc = XmlEscape(text);
        if (esc.size() < text.size())
            abort();
    }
}

void SendEvent(const char *sid, IXML_Document *doc)
{
    UpnpEvent *e = UpnpEvent_new();
    UpnpEvent_strcpy_SID(e, sid);
    UpnpEvent_set_ChangedVariables(e, doc);
    A::OnEventReceived(*g_controller, e);
    UpnpEvent_delete(e);
}

void SendAnswer(const std::string &ctrlUrl, IXML_Document *doc)
{
    UpnpActionComplete *a = UpnpActionComplete_new();
    UpnpActionComplete_set_ErrCode(a, 0);
    UpnpActionComplete_strcpy_CtrlUrl(a, ctrlUrl.c_str());
    UpnpActionComplete_set_ActionResult(a, doc);
    A::OnActionComplete(*g_controller, a);
    UpnpActionComplete_delete(a);
}

}  // namespace

// ixml itself leaks the text node it was building when a document breaks off
// after its root element (reproduced with a plain ixmlParseBufferEx call on
// such a text); nothing of ours creates text nodes.
extern "C" const char *__lsan_default_suppressions()
{
    return "leak:ixmlDocument_createTextNodeEx\n";
}

extern "C" int LLVMFuzzerInitialize(int *, char ***)
{
    FuzzMakeRoot();
    g_controller = new UpnpController();
    IXML_Document *doc = nullptr;
    if (ixmlParseBufferEx(kDescription, &doc) != IXML_SUCCESS)
        abort();
    A::AddRenderer(*g_controller, doc, "http://127.0.0.1:1/description.xml");
    ixmlDocument_free(doc);
    if (A::Renderers(*g_controller).size() != 1)
        abort();
    g_renderer = A::Renderers(*g_controller)[0];
    Subscribe(g_renderer->avt_event_url, "uuid:avt-sid");
    Subscribe(g_renderer->rcs_event_url, "uuid:rcs-sid");
    g_controller->Lock();
    g_controller->SelectRenderer(0);
    g_controller->Unlock();
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size)
{
    if (size < 1 || size > 512 * 1024)
        return 0;
    int mode = data[0] % 6;
    std::string text(reinterpret_cast<const char *>(data + 1), size - 1);
    if (mode == 1 || mode == 2) {
        text = "<e:propertyset xmlns:e=\"urn:schemas-upnp-org:event-1-0\"><e:property><LastChange>" +
               XmlEscape(text) + "</LastChange></e:property></e:propertyset>";
    }
    // The guard sees the bytes as they came (with any NULs); ixml sees a C text.
    XmlCheckLimits(text.data(), text.size());
    IXML_Document *doc = nullptr;
    if (XmlParseGuarded(text.c_str(), &doc) != IXML_SUCCESS || doc == nullptr)
        return 0;
    Helpers(doc);
    switch (mode) {
    case 0:
    case 1:
        SendEvent("uuid:avt-sid", doc);
        break;
    case 2:
        SendEvent("uuid:rcs-sid", doc);
        break;
    case 3:
        SendAnswer(g_renderer->avt_control_url, doc);
        break;
    case 4:
        SendAnswer(g_renderer->rcs_control_url, doc);
        break;
    default: {
        A::AddRenderer(*g_controller, doc, "http://127.0.0.1:1/description.xml");
        // Only the first renderer stays listed.
        while (A::Renderers(*g_controller).size() > 1)
            A::RemoveRenderer(*g_controller, 1);
        if (A::Renderers(*g_controller)[0] != g_renderer)
            abort();
        break;
    }
    }
    ixmlDocument_free(doc);
    // The state the events and answers left goes into a status reply.
    Json::Value reply;
    g_controller->Lock();
    g_controller->GetRendererState(reply);
    g_controller->Unlock();
    Json::StyledWriter writer;
    std::string out = writer.write(reply);
    (void)out;
    return 0;
}
