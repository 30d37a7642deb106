// The UPnP control point's discovery and device lists: the search answers and
// announcements that add and remove media servers and renderers, the list
// maintenance and the list replies.
#include "upnp/upnp.h"

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <strings.h>

#include "platform/tarn_log.h"
#include "platform/tlibc_conf.h"
#include "upnp/get_capability.h"
#include "upnp/upnp_internal.h"
#include "upnp/xml_util.h"

// Devices listed of each kind at most ("upnp_devices_max", read once): a
// LAN that announces more, or a host that announces made-up devices, cannot
// grow the daemon without end.
static const unsigned long kListMaxDefault = 256;

// True when a list of that size takes no more devices; logged at most once
// a minute. Called under the controller's lock.
static bool ListFull(size_t size, const char *kind, const std::string &udn)
{
    static const size_t max = TarnConfNumber("upnp_devices_max", kListMaxDefault);
    static time_t lastLog = 0;
    if (size < max)
        return false;
    time_t now = time(nullptr);
    if (now - lastLog >= 60) {
        lastLog = now;
        TLOG("Too many %s listed (%zu, upnp_devices_max): [%.64s] and later ones left out", kind,
             size, udn.c_str());
    }
    return true;
}

// ---------------------------------------------------------------------------
// List maintenance.

int UpnpController::ClearList(const char *kind)
{
    if (kind == nullptr)
        return -1;
    ScopedLock lock(this);
    if (strcmp(kind, "server") == 0) {
        for (SERVER_INFO *s : servers)
            delete s;
        servers.clear();
        return 0;
    }
    if (strcmp(kind, "renderer") == 0) {
        for (RENDERER_INFO *r : renderers)
            delete r;
        renderers.clear();
        current = 0;
        return 0;
    }
    return -1;
}

int UpnpController::Refresh(const char *kind)
{
    if (ClearList(kind) != 0)
        return -1;
    if (strcmp(kind, "server") == 0)
        return SearchServers() != 0 ? -1 : 0;
    return SearchRenderers() != 0 ? -1 : 0;
}

int UpnpController::SelectRenderer(unsigned index)
{
    if (index >= renderers.size()) {
        TLOG("Bad parameters, Index[%d]", static_cast<int>(index));
        return -1;
    }
    current = index;
    return 0;
}

int UpnpController::GetRenderer(unsigned index, RENDERER_INFO **out)
{
    if (index >= renderers.size()) {
        TLOG("Bad index [%u]", index);
        return -1;
    }
    if (renderers[index] == nullptr) {
        TLOG("RENDERER_INFO in list is NULL, index[%d]", static_cast<int>(index));
        return -1;
    }
    if (out != nullptr)
        *out = renderers[index];
    return 0;
}

int UpnpController::GetCurrentRenderer(RENDERER_INFO **out)
{
    return GetRenderer(current, out);
}

int UpnpController::FindRendererByUdn(const std::string &udn)
{
    for (size_t i = 0; i < renderers.size(); ++i) {
        if (renderers[i] != nullptr && renderers[i]->udn == udn)
            return static_cast<int>(i);
    }
    return -1;
}

int UpnpController::FindServerByUdn(const std::string &udn)
{
    for (size_t i = 0; i < servers.size(); ++i) {
        if (servers[i] != nullptr && servers[i]->udn == udn)
            return static_cast<int>(i);
    }
    return -1;
}

// ---------------------------------------------------------------------------
// List replies. The caller holds the lock (the request handler takes it
// around these calls).

namespace {

// One page of a device list: entries from start, at most limit of them (no
// bound for 0), each filled by fill(record, item).
template <typename Info, typename Fill>
void ListPage(const std::vector<Info *> &records, int &start, int &limit, Json::Value &reply, Fill fill)
{
    if (start < 0)
        start = 0;
    if (limit < 0)
        limit = 10;
    Json::Value list(Json::arrayValue);
    for (size_t i = 0; i < records.size(); ++i) {
        int index = static_cast<int>(i);
        if (index < start || records[i] == nullptr)
            continue;
        const Info *r = records[i];
        Json::Value item(Json::objectValue);
        item["friendly_name"] = r->friendly_name;
        item["udn"] = r->udn;
        item["ip"] = r->ip;
        item["port"] = r->port;
        fill(*r, item);
        item["index"] = index;
        list.append(item);
        if (limit > 0 && index + 1 - start >= limit)
            break;
    }
    reply["list"] = list;
    reply["start"] = start;
    reply["limit"] = limit;
}

}  // namespace

int UpnpController::GetServerList(Json::Value &reply, int start, int limit)
{
    ListPage(servers, start, limit, reply, [](const SERVER_INFO &s, Json::Value &item) {
        item["control_url"] = s.cds_control_url;
    });
    reply["total"] = Json::UInt(servers.size());
    return 0;
}

int UpnpController::GetRendererList(Json::Value &reply, int start, int limit)
{
    ListPage(renderers, start, limit, reply, [](const RENDERER_INFO &r, Json::Value &item) {
        item["seek"] = r.can_seek;
        item["set_volume"] = r.can_set_volume;
    });
    reply["current"] = Json::UInt(current.load());
    reply["total"] = Json::UInt(renderers.size());
    return 0;
}

int UpnpController::GetRendererState(Json::Value &reply)
{
    uint32_t index = current;
    if (index >= renderers.size() || renderers[index] == nullptr)
        return -1;
    const RENDERER_INFO *r = renderers[index];
    reply["CurrentURI"] = r->current_uri;
    reply["Duration"] = r->duration;
    reply["RelTime"] = r->rel_time;
    reply["TransportState"] = r->transport_state;
    reply["RendererIndex"] = Json::UInt(index);
    reply["RendererFriendlyName"] = r->friendly_name;
    reply["Volume"] = r->volume;
    reply["Mute"] = r->mute;
    return 0;
}

// ---------------------------------------------------------------------------
// Discovery.

int UpnpController::OnUpnpEvent(Upnp_EventType type, const void *event, void *cookie)
{
    UpnpController *self = static_cast<UpnpController *>(cookie);
    if (self == nullptr)
        return -1;
    switch (type) {
    case UPNP_CONTROL_ACTION_COMPLETE: {
        const UpnpActionComplete *done = static_cast<const UpnpActionComplete *>(event);
        int rc = self->OnActionComplete(done);
#if UPNP_VERSION < 11416
        // libupnp before 1.14.16 hands its copy of the action and the answer
        // to this callback and never frees either: without this every
        // asynchronous action (two a second while a renderer plays) leaks.
        if (done != nullptr) {
            UpnpActionComplete *owned = const_cast<UpnpActionComplete *>(done);
            IXML_Document *request = UpnpActionComplete_get_ActionRequest(done);
            IXML_Document *result = UpnpActionComplete_get_ActionResult(done);
            UpnpActionComplete_set_ActionRequest(owned, nullptr);
            UpnpActionComplete_set_ActionResult(owned, nullptr);
            if (request != nullptr)
                ixmlDocument_free(request);
            if (result != nullptr)
                ixmlDocument_free(result);
        }
#endif
        return rc;
    }
    case UPNP_DISCOVERY_ADVERTISEMENT_ALIVE:
    case UPNP_DISCOVERY_SEARCH_RESULT:
        self->OnDiscovery(static_cast<const UpnpDiscovery *>(event));
        return -1;
    case UPNP_DISCOVERY_ADVERTISEMENT_BYEBYE:
        self->OnByeBye(static_cast<const UpnpDiscovery *>(event));
        return -1;
    case UPNP_EVENT_RECEIVED:
        return self->OnEventReceived(static_cast<const UpnpEvent *>(event));
    case UPNP_EVENT_RENEWAL_COMPLETE:
    case UPNP_EVENT_SUBSCRIBE_COMPLETE:
    case UPNP_EVENT_UNSUBSCRIBE_COMPLETE:
        self->OnSubscription(static_cast<const UpnpEventSubscribe *>(event));
        return -1;
    case UPNP_EVENT_AUTORENEWAL_FAILED:
    case UPNP_EVENT_SUBSCRIPTION_EXPIRED: {
        // No more events from that renderer: its answers count again.
        const char *publisher =
            UpnpEventSubscribe_get_PublisherUrl_cstr(static_cast<const UpnpEventSubscribe *>(event));
        ScopedLock lock(self);
        for (RENDERER_INFO *r : self->renderers)
            if (r != nullptr && publisher != nullptr && r->avt_event_url == publisher)
                r->transport_events = false;
        return -1;
    }
    default:
        return -1;
    }
}

int UpnpController::OnDiscovery(const UpnpDiscovery *event)
{
    if (event == nullptr || UpnpDiscovery_get_ErrCode(event) != UPNP_E_SUCCESS)
        return -1;
    const char *serviceType = UpnpDiscovery_get_ServiceType_cstr(event);
    const char *location = UpnpDiscovery_get_Location_cstr(event);
    if (serviceType == nullptr || location == nullptr)
        return -1;
    // Devices that announce later versions of the services are taken too:
    // those versions keep the version-1 actions.
    bool renderer = IsServiceType(serviceType, "AVTransport");
    bool server = !renderer && IsServiceType(serviceType, "ContentDirectory");
    if (!renderer && !server)
        return 0;
    // Downloaded outside the lock: a slow device holds only this thread.
    IXML_Document *doc = nullptr;
    int rc = XmlDownloadDoc(location, &doc);
    if (rc != UPNP_E_SUCCESS || doc == nullptr) {
        if (doc != nullptr)
            ixmlDocument_free(doc);
        return -1;
    }
    if (renderer)
        AddRenderer(doc, location);
    else
        AddServer(doc, location);
    ixmlDocument_free(doc);
    return 0;
}

void UpnpController::AddServer(IXML_Document *doc, const char *location)
{
    if (doc == nullptr || location == nullptr) {
        TLOG("Bad parameter");
        return;
    }
    SERVER_INFO *server = new SERVER_INFO();
    server->udn = XmlGetDocElementText(doc, "UDN");
    server->friendly_name = XmlGetDocElementText(doc, "friendlyName");
    (void)XmlGetDocElementText(doc, "presentationURL");
    if (server->udn.size() != 41 || ParseHttpUrl(location, server->ip, server->port) != 0 ||
        server->ip == "127.0.0.1") {
        delete server;
        return;
    }
    server->base_url = "http://" + server->ip + ":" + server->port;

    IXML_NodeList *services = ixmlDocument_getElementsByTagName(doc, "service");
    if (services == nullptr) {
        delete server;
        return;
    }
    unsigned long count = ixmlNodeList_length(services);
    for (unsigned long i = 0; i < count; ++i) {
        IXML_Element *service = reinterpret_cast<IXML_Element *>(ixmlNodeList_item(services, i));
        if (IsServiceType(XmlGetElementChildText(service, "serviceType").c_str(), "ContentDirectory"))
            server->cds_control_url =
                ResolveUrl(server->base_url, XmlGetElementChildText(service, "controlURL"));
    }
    ixmlNodeList_free(services);

    ScopedLock lock(this);
    if (FindServerByUdn(server->udn) >= 0 || ListFull(servers.size(), "servers", server->udn)) {
        delete server;
        return;
    }
    size_t position = servers.size();
    for (size_t i = 0; i < servers.size(); ++i) {
        if (servers[i] != nullptr &&
            strcasecmp(server->friendly_name.c_str(), servers[i]->friendly_name.c_str()) <= 0) {
            position = i;
            break;
        }
    }
    servers.insert(servers.begin() + static_cast<long>(position), server);
}

// The control, event and description URLs and the type of each service of
// a renderer's description.
void UpnpController::ReadRendererServices(IXML_Document *doc, RENDERER_INFO *renderer)
{
    IXML_NodeList *services = ixmlDocument_getElementsByTagName(doc, "service");
    unsigned long count = services != nullptr ? ixmlNodeList_length(services) : 0;
    for (unsigned long i = 0; i < count; ++i) {
        IXML_Element *service = reinterpret_cast<IXML_Element *>(ixmlNodeList_item(services, i));
        std::string type = XmlGetElementChildText(service, "serviceType");
        std::string *control, *event, *scpd, *kind;
        if (IsServiceType(type.c_str(), "ConnectionManager")) {
            control = &renderer->cms_control_url;
            event = &renderer->cms_event_url;
            scpd = &renderer->cms_scpd_url;
            kind = &renderer->cms_type;
        } else if (IsServiceType(type.c_str(), "RenderingControl")) {
            control = &renderer->rcs_control_url;
            event = &renderer->rcs_event_url;
            scpd = &renderer->rcs_scpd_url;
            kind = &renderer->rcs_type;
        } else if (IsServiceType(type.c_str(), "AVTransport")) {
            control = &renderer->avt_control_url;
            event = &renderer->avt_event_url;
            scpd = &renderer->avt_scpd_url;
            kind = &renderer->avt_type;
        } else {
            continue;
        }
        // The first service of a kind counts (a device lists each once).
        if (!kind->empty())
            continue;
        *kind = type;
        *control = ResolveUrl(renderer->base_url, XmlGetElementChildText(service, "controlURL"));
        *event = ResolveUrl(renderer->base_url, XmlGetElementChildText(service, "eventSubURL"));
        *scpd = ResolveUrl(renderer->base_url, XmlGetElementChildText(service, "SCPDURL"));
    }
    if (services != nullptr)
        ixmlNodeList_free(services);
}

void UpnpController::AddRenderer(IXML_Document *doc, const char *location)
{
    if (doc == nullptr || location == nullptr) {
        TLOG("Bad parameter");
        return;
    }
    RENDERER_INFO *renderer = new RENDERER_INFO();
    renderer->udn = XmlGetDocElementText(doc, "UDN");
    {
        // Every announcement comes here; a listed renderer is not probed again.
        ScopedLock lock(this);
        if (FindRendererByUdn(renderer->udn) >= 0 ||
            ListFull(renderers.size(), "renderers", renderer->udn)) {
            delete renderer;
            return;
        }
    }
    renderer->friendly_name = XmlGetDocElementText(doc, "friendlyName");
    if (ParseHttpUrl(location, renderer->ip, renderer->port) != 0) {
        delete renderer;
        return;
    }
    renderer->base_url = "http://" + renderer->ip + ":" + renderer->port;

    ReadRendererServices(doc, renderer);

    // The two service descriptions are fetched without the lock, so that a
    // slow renderer never stalls the main loop or the other callbacks.
    if (GetRendererCapability(doc, renderer) != 0)
        TLOG("Failed to get renderer capability");
    renderer->duration = 0;
    renderer->rel_time = 0;
    std::string avtEventUrl = renderer->avt_event_url;
    std::string rcsEventUrl = renderer->rcs_event_url;
    {
        ScopedLock lock(this);
        // Another announcement of the same renderer may have won meanwhile.
        if (FindRendererByUdn(renderer->udn) >= 0 ||
            ListFull(renderers.size(), "renderers", renderer->udn)) {
            delete renderer;
            return;
        }
        renderers.push_back(renderer);
    }
    Wake();
    int rc = UpnpSubscribeAsync(client_handle, avtEventUrl.c_str(), kSubscribeTimeout,
                                OnUpnpEvent, this);
    if (rc != UPNP_E_SUCCESS)
        TLOG("Failed to subscribe, [%s]", avtEventUrl.c_str());
    rc = UpnpSubscribeAsync(client_handle, rcsEventUrl.c_str(), kSubscribeTimeout, OnUpnpEvent,
                            this);
    if (rc != UPNP_E_SUCCESS)
        TLOG("Failed to subscribe, [%s]", rcsEventUrl.c_str());
}

int UpnpController::OnByeBye(const UpnpDiscovery *event)
{
    if (event == nullptr) {
        TLOG("Event is NULL");
        return -1;
    }
    if (UpnpDiscovery_get_ErrCode(event) != UPNP_E_SUCCESS) {
        TLOG("Event error code != success");
        return -1;
    }
    const char *serviceType = UpnpDiscovery_get_ServiceType_cstr(event);
    const char *deviceId = UpnpDiscovery_get_DeviceID_cstr(event);
    if (serviceType == nullptr || deviceId == nullptr)
        return 0;
    bool removed = false;
    {
        ScopedLock lock(this);
        if (IsServiceType(serviceType, "AVTransport")) {
            int index = FindRendererByUdn(deviceId);
            if (index >= 0)
                removed = RemoveRenderer(static_cast<unsigned>(index)) == 0;
        } else if (IsServiceType(serviceType, "ContentDirectory")) {
            int index = FindServerByUdn(deviceId);
            if (index >= 0)
                RemoveServer(static_cast<unsigned>(index));
        }
    }
    if (removed)
        Wake();
    return 0;
}

int UpnpController::RemoveServer(unsigned index)
{
    if (index >= servers.size()) {
        TLOG("Bad parameter, Index:%d, list size:%d", static_cast<int>(index),
             static_cast<int>(servers.size()));
        return -1;
    }
    if (servers[index] == nullptr) {
        TLOG("NULL server info in server list");
        return -1;
    }
    delete servers[index];
    servers.erase(servers.begin() + index);
    return 0;
}

int UpnpController::RemoveRenderer(unsigned index)
{
    RENDERER_INFO *renderer = nullptr;
    if (GetRenderer(index, &renderer) != 0) {
        TLOG("NULL server info in server list");
        return -1;
    }
    uint32_t selected = current;
    if (index < selected)
        selected = selected - 1;
    if (index == selected)
        selected = kNoRenderer;
    current = selected;
    delete renderer;
    renderers.erase(renderers.begin() + index);
    return 0;
}
