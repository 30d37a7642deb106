// The UPnP control point's event subscriptions and the events renderers send.
#include "upnp/upnp.h"

#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "platform/tarn_log.h"
#include "upnp/upnp_internal.h"
#include "upnp/xml_util.h"

// ---------------------------------------------------------------------------
// Subscriptions and events.

int UpnpController::OnSubscription(const UpnpEventSubscribe *event)
{
    if (event == nullptr)
        return -1;
    const char *publisher = UpnpEventSubscribe_get_PublisherUrl_cstr(event);
    int code = UpnpEventSubscribe_get_ErrCode(event);
    if (code != UPNP_E_SUCCESS) {
        TLOG("Failed to subscribe, [%s], url [%s]", UpnpGetErrorMessage(code),
             publisher != nullptr ? publisher : "");
        return -1;
    }
    if (publisher == nullptr)
        return -1;
    const char *sid = UpnpEventSubscribe_get_SID_cstr(event);
    ScopedLock lock(this);
    for (RENDERER_INFO *r : renderers) {
        if (r == nullptr)
            continue;
        std::string *target = nullptr;
        if (r->avt_event_url == publisher)
            target = &r->avt_sid;
        else if (r->cms_event_url == publisher)
            target = &r->cms_sid;
        else if (r->rcs_event_url == publisher)
            target = &r->rcs_sid;
        if (target != nullptr) {
            *target = sid != nullptr ? sid : "";
            return 0;
        }
    }
    return 0;
}

int UpnpController::OnEventReceived(const UpnpEvent *event)
{
    if (event == nullptr)
        return -1;
    const char *sid = UpnpEvent_get_SID_cstr(event);
    if (sid == nullptr)
        return 0;
    bool wake = false;
    {
        ScopedLock lock(this);
        for (RENDERER_INFO *r : renderers) {
            if (r == nullptr)
                continue;
            if (r->avt_sid == sid || r->cms_sid == sid || r->rcs_sid == sid) {
                // libupnp may hand two events of one subscription to two
                // threads: one older than the last handled is dropped.
                long *last = r->avt_sid == sid ? &r->avt_event_key
                             : r->rcs_sid == sid ? &r->rcs_event_key : nullptr;
                long key = UpnpEvent_get_EventKey(event);
                if (last != nullptr) {
                    if (key < *last && *last - key < (1L << 30))
                        return 0;
                    *last = key;
                }
                std::string state = r->transport_state, uri = r->current_uri, next = r->next_uri;
                if (UpdateFromLastChange(r, event) != 0) {
                    TLOG("Failed to update upnp renderer state");
                    return -1;
                }
                wake = state != r->transport_state || uri != r->current_uri || next != r->next_uri;
                break;
            }
        }
    }
    if (wake)
        Wake();
    return 0;
}

int UpnpController::UpdateFromLastChange(RENDERER_INFO *renderer, const UpnpEvent *event)
{
    if (renderer == nullptr || event == nullptr) {
        TLOG("Bad parameter");
        return -1;
    }
    IXML_Document *changed = UpnpEvent_get_ChangedVariables(event);
    if (changed == nullptr)
        return 0;
    IXML_Element *lastChange = XmlGetDocElement(changed, "LastChange");
    if (lastChange == nullptr)
        return 0;
    std::string text = XmlGetNodeText(reinterpret_cast<IXML_Node *>(lastChange));
    // The text comes from the renderer: it is refused when too big or nested
    // too deeply for ixml before it is parsed.
    IXML_Document *doc = nullptr;
    int err = XmlParseGuarded(text.c_str(), &doc);
    if (err != IXML_SUCCESS || doc == nullptr) {
        TLOG("Failed to parse LastChange, err=%d", err);
        if (doc != nullptr)
            ixmlDocument_free(doc);
        return 0;
    }
    std::string value = XmlGetDocElementVal(doc, "CurrentTrackURI");
    if (!value.empty())
        renderer->current_uri = value;
    value = XmlGetDocElementVal(doc, "TransportState");
    if (!value.empty()) {
        renderer->transport_state = value;
        renderer->transport_events = true;
        ++renderer->state_reports;
        if (value == "PLAYING")
            ++renderer->playing_reports;
    }
    // The next song as the renderer holds it; an empty val clears it (the
    // renderer moved on to it, or dropped it).
    if (XmlGetDocElement(doc, "NextAVTransportURI") != nullptr)
        renderer->next_uri = value = XmlGetDocElementVal(doc, "NextAVTransportURI");
    value = XmlGetDocElementVal(doc, "CurrentTrackDuration");
    if (!value.empty())
        renderer->duration = TimeStringToSeconds(value.c_str());
    value = XmlGetDocElementVal(doc, "Volume");
    if (!value.empty())
        renderer->volume = value;
    value = XmlGetDocElementVal(doc, "Mute");
    if (!value.empty())
        renderer->mute = value;
    ixmlDocument_free(doc);
    return 0;
}
