// The daemon's UPnP control point: finds media servers and renderers, keeps
// their lists, sends actions to the selected renderer and copies what the
// renderers answer and announce into their records.
//
// libupnp calls OnUpnpEvent on its own worker threads; everything those
// threads touch (both lists and every record in them) is guarded by one plain
// mutex. The main loop takes the same mutex around its turn over the
// renderer players, and every action is sent from inside that turn.
#include "upnp/upnp.h"

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <strings.h>

#include <curl/curl.h>


#include "platform/tarn_log.h"
#include "platform/tlibc_conf.h"
#include "upnp/get_capability.h"
#include "upnp/xml_util.h"

static const char kLogUnit[] = "upnp";

static const char kCdsType[] = "urn:schemas-upnp-org:service:ContentDirectory:1";
static const char kAvtType[] = "urn:schemas-upnp-org:service:AVTransport:1";
static const char kRcsType[] = "urn:schemas-upnp-org:service:RenderingControl:1";
static const char kCmsType[] = "urn:schemas-upnp-org:service:ConnectionManager:1";

static const int kSearchMx = 1800;
static const int kQuickSearchMx = 1;
// Polling requests are not sent while this many AVTransport requests to the
// renderer are unanswered (a renderer that stopped answering).
static const int kMaxOutstanding = 4;
static const int kSubscribeTimeout = 1800;
static const int kMaxContentLength = 32000;
static const uint32_t kNoRenderer = static_cast<uint32_t>(-1);
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

// Locks the controller's mutex for one scope.
namespace {
class ScopedLock {
public:
    explicit ScopedLock(UpnpController *c) : controller(c) { controller->Lock(); }
    ~ScopedLock() { controller->Unlock(); }
    ScopedLock(const ScopedLock &) = delete;
    ScopedLock &operator=(const ScopedLock &) = delete;

private:
    UpnpController *controller;
};
}  // namespace

UpnpController::UpnpController() : current(kNoRenderer), client_handle(-1)
{
    pthread_mutex_init(&mutex, nullptr);
}

UpnpController::~UpnpController()
{
    for (RENDERER_INFO *r : renderers)
        delete r;
    for (SERVER_INFO *s : servers)
        delete s;
    pthread_mutex_destroy(&mutex);
}

// ---------------------------------------------------------------------------
// Start and stop.

int UpnpController::Init()
{
    // libupnp's worker pool keeps its built-in bounds: this libupnp offers no
    // call to change them. Description downloads use libcurl from libupnp's
    // threads; its global state is set up here, before they exist.
    curl_global_init(CURL_GLOBAL_DEFAULT);
    XmlAbortDownloads(false);
    int rc = UpnpInit(nullptr, 0);
    if (rc != UPNP_E_SUCCESS) {
        TLOG("Failed to UpnpInit(), [%s]", UpnpGetErrorMessage(rc));
        UpnpFinish();
        return -1;
    }
    rc = UpnpSetMaxContentLength(kMaxContentLength);
    if (rc != UPNP_E_SUCCESS) {
        TLOG("Failed to (UpnpSetMaxContentLength), [%s]", UpnpGetErrorMessage(rc));
        UpnpFinish();
        return -1;
    }
    (void)UpnpGetServerIpAddress();
    (void)UpnpGetServerPort();
    rc = UpnpRegisterClient(OnUpnpEvent, this, &client_handle);
    if (rc != UPNP_E_SUCCESS) {
        TLOG("Failed to UpnpInit(), [%s]", UpnpGetErrorMessage(rc));
        UpnpFinish();
        return -1;
    }
    // The mutex exists from construction on (the lists can be read before
    // Init and after a failed Init).
    return 0;
}

int UpnpController::Uninit()
{
    // Description downloads in progress on libupnp's threads give up, so
    // that UpnpFinish does not wait for slow devices.
    XmlAbortDownloads(true);
    UpnpUnRegisterClient(client_handle);
    UpnpFinish();
    client_handle = -1;
    return 0;
}

void UpnpController::Lock()
{
    pthread_mutex_lock(&mutex);
}

void UpnpController::Unlock()
{
    pthread_mutex_unlock(&mutex);
}

// ---------------------------------------------------------------------------
// Searches and list maintenance.

bool UpnpController::IsServiceType(const char *type, const char *service)
{
    static const char kPrefix[] = "urn:schemas-upnp-org:service:";
    size_t prefix = sizeof(kPrefix) - 1, length = strlen(service);
    if (type == nullptr || strncmp(type, kPrefix, prefix) != 0 ||
        strncmp(type + prefix, service, length) != 0 || type[prefix + length] != ':')
        return false;
    const char *version = type + prefix + length + 1;
    if (*version < '1' || *version > '9')
        return false;
    for (const char *p = version; *p; ++p)
        if (*p < '0' || *p > '9')
            return false;
    return true;
}

int UpnpController::Search(const char *target)
{
    return Search(target, kSearchMx);
}

int UpnpController::SearchQuick()
{
    int a = Search(kCdsType, kQuickSearchMx);
    int b = Search(kAvtType, kQuickSearchMx);
    return a == 0 && b == 0 ? 0 : -1;
}

int UpnpController::Search(const char *target, int mx)
{
    if (target == nullptr)
        return -1;
    int rc = UpnpSearchAsync(client_handle, mx, target, this);
    if (rc != UPNP_E_SUCCESS) {
        TLOG("Failed to search [%s], [%s]", target, UpnpGetErrorMessage(rc));
        return -1;
    }
    return 0;
}

int UpnpController::SearchServers()
{
    return Search(kCdsType);
}

int UpnpController::SearchRenderers()
{
    return Search(kAvtType);
}

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
// URLs.

int UpnpController::ParseHttpUrl(const std::string &location, std::string &ip, std::string &port)
{
    if (location.find("http://") == std::string::npos || location.size() < 7)
        return -1;
    size_t slash = location.find('/', 7);
    size_t colon = location.find(':', 7);
    if (colon == std::string::npos) {
        ip = location.substr(7, slash == std::string::npos ? std::string::npos : slash - 7);
        port = "80";
        return 0;
    }
    ip = location.substr(7, colon - 7);
    if (slash == std::string::npos || slash < colon)
        port = location.substr(colon + 1);
    else
        port = location.substr(colon + 1, slash - colon - 1);
    return 0;
}

std::string UpnpController::ResolveUrl(const std::string &base, const std::string &relative)
{
    char *resolved = nullptr;
    int rc = UpnpResolveURL2(base.c_str(), relative.c_str(), &resolved);
    if (rc != UPNP_E_SUCCESS || resolved == nullptr) {
        TLOG("Failed to UpnpResolveURL().");
        free(resolved);
        return std::string();
    }
    std::string result(resolved);
    free(resolved);
    return result;
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

// ---------------------------------------------------------------------------
// Actions.

int UpnpController::SendAction(const char *actionName, const char *serviceType,
                               const char **argNames, const char **argValues, int count)
{
    if (actionName == nullptr || serviceType == nullptr || argNames == nullptr ||
        argValues == nullptr) {
        TLOG("Bad parameters.");
        return -1;
    }
    RENDERER_INFO *renderer = nullptr;
    if (GetRenderer(current, &renderer) != 0) {
        TLOG("Invalid index[%d]", static_cast<int>(current.load()));
        return -1;
    }
    return SendActionTo(renderer, actionName, serviceType, argNames, argValues, count);
}

int UpnpController::SendActionTo(RENDERER_INFO *renderer, const char *actionName,
                                 const char *serviceType, const char **argNames,
                                 const char **argValues, int count)
{
    const std::string *controlUrl;
    const std::string *ownType;
    bool avt = false;
    if (strcmp(serviceType, kAvtType) == 0) {
        controlUrl = &renderer->avt_control_url;
        ownType = &renderer->avt_type;
        avt = true;
    } else if (strcmp(serviceType, kCmsType) == 0) {
        controlUrl = &renderer->cms_control_url;
        ownType = &renderer->cms_type;
    } else if (strcmp(serviceType, kRcsType) == 0) {
        controlUrl = &renderer->rcs_control_url;
        ownType = &renderer->rcs_type;
    } else {
        TLOG("Unsupport service type [%s]", serviceType);
        return -1;
    }
    // The version-1 action, addressed to the service as the device names it.
    if (!ownType->empty())
        serviceType = ownType->c_str();
    IXML_Document *action = nullptr;
    for (int i = 0; i < count; ++i) {
        int rc = UpnpAddToAction(&action, actionName, serviceType, argNames[i], argValues[i]);
        if (rc != UPNP_E_SUCCESS) {
            TLOG("Failed to add upnp action. [%s]", UpnpGetErrorMessage(rc));
            if (action != nullptr)
                ixmlDocument_free(action);
            return -1;
        }
    }
    if (action == nullptr)
        action = UpnpMakeAction(actionName, serviceType, 0, nullptr);
    int rc = UpnpSendActionAsync(client_handle, controlUrl->c_str(), serviceType, nullptr, action,
                                 OnUpnpEvent, this);
    if (action != nullptr)
        ixmlDocument_free(action);
    if (rc != UPNP_E_SUCCESS)
        return -1;
    if (avt)
        ++renderer->outstanding;
    return 0;
}

RendererAction UpnpController::MakeAction(const char *name, std::vector<std::string> names,
                                          std::vector<std::string> values)
{
    RendererAction a;
    a.name = name;
    a.argNames = std::move(names);
    a.argValues = std::move(values);
    return a;
}

void UpnpController::SendJobStep(RENDERER_INFO *renderer)
{
    while (!renderer->job_steps.empty()) {
        RendererAction step = renderer->job_steps.front();
        renderer->job_steps.erase(renderer->job_steps.begin());
        std::vector<const char *> names, values;
        for (size_t i = 0; i < step.argNames.size() && i < step.argValues.size(); ++i) {
            names.push_back(step.argNames[i].c_str());
            values.push_back(step.argValues[i].c_str());
        }
        if (SendActionTo(renderer, step.name.c_str(), kAvtType, names.data(), values.data(),
                         static_cast<int>(names.size())) == 0) {
            renderer->job_sent = step.name;
            renderer->job_sent_for = renderer->job_id;
            return;
        }
        TLOG("Failed to send action [%s]", step.name.c_str());
        renderer->job_steps.clear();
        renderer->job_failed = step.name;
        renderer->job_error = UPNP_E_INTERNAL_ERROR;
        renderer->job_done = renderer->job_id;
    }
}

long UpnpController::StartJob(const std::vector<RendererAction> &steps)
{
    RENDERER_INFO *renderer = nullptr;
    if (steps.empty() || GetRenderer(current, &renderer) != 0) {
        TLOG("Invalid index[%d]", static_cast<int>(current.load()));
        return -1;
    }
    if (++lastJobId == 0)
        lastJobId = 1;
    renderer->job_id = lastJobId;
    renderer->job_steps = steps;
    renderer->job_failed.clear();
    // One action at a time: a new job waits for the answer to the action
    // still in flight, so that the renderer takes them in order.
    if (renderer->job_sent.empty())
        SendJobStep(renderer);
    if (renderer->job_done == renderer->job_id && renderer->job_error != 0)
        return -1;
    return static_cast<long>(renderer->job_id);
}

void UpnpController::CancelJob()
{
    RENDERER_INFO *renderer = nullptr;
    if (GetRenderer(current, &renderer) != 0)
        return;
    renderer->job_steps.clear();
    if (renderer->job_sent.empty()) {
        renderer->job_done = renderer->job_id;
        renderer->job_error = 0;
    }
}

// Sends one action and logs when libupnp refuses it.
#define TARN_SEND(name, type, names, values)                                              \
    do {                                                                                  \
        if (SendAction(name, type, names, values,                                         \
                       static_cast<int>(sizeof(names) / sizeof(names[0]))) != 0) {        \
            TLOG("Failed to send action [%s]", name);                                     \
            return -1;                                                                    \
        }                                                                                 \
        return 0;                                                                         \
    } while (0)

int UpnpController::SetAVTransportURI(const char *uri, const char *metadata)
{
    if (uri == nullptr) {
        TLOG("Bad parameter.");
        return -1;
    }
    const char *names[] = {"InstanceID", "CurrentURI", "CurrentURIMetaData"};
    const char *values[] = {"0", uri, metadata != nullptr ? metadata : ""};
    TARN_SEND("SetAVTransportURI", kAvtType, names, values);
}

// A renderer that leaves requests unanswered is not asked more.
#define TARN_SKIP_WHEN_BUSY()                                                              \
    do {                                                                                  \
        RENDERER_INFO *busy = nullptr;                                                    \
        if (GetRenderer(current, &busy) == 0 && busy->outstanding >= kMaxOutstanding)     \
            return 0;                                                                     \
    } while (0)

int UpnpController::GetPositionInfo()
{
    TARN_SKIP_WHEN_BUSY();
    const char *names[] = {"InstanceID"};
    const char *values[] = {"0"};
    TARN_SEND("GetPositionInfo", kAvtType, names, values);
}

int UpnpController::GetTransportInfo()
{
    TARN_SKIP_WHEN_BUSY();
    const char *names[] = {"InstanceID"};
    const char *values[] = {"0"};
    TARN_SEND("GetTransportInfo", kAvtType, names, values);
}

int UpnpController::Play()
{
    const char *names[] = {"InstanceID", "Speed"};
    const char *values[] = {"0", "1"};
    TARN_SEND("Play", kAvtType, names, values);
}

int UpnpController::Pause()
{
    const char *names[] = {"InstanceID"};
    const char *values[] = {"0"};
    TARN_SEND("Pause", kAvtType, names, values);
}

int UpnpController::Stop()
{
    const char *names[] = {"InstanceID"};
    const char *values[] = {"0"};
    TARN_SEND("Stop", kAvtType, names, values);
}

int UpnpController::SetVolume(int volume)
{
    char text[8];
    snprintf(text, sizeof(text), "%d", volume);
    const char *names[] = {"InstanceID", "Channel", "DesiredVolume"};
    const char *values[] = {"0", "Master", text};
    TARN_SEND("SetVolume", kRcsType, names, values);
}

int UpnpController::SetMute(int mute)
{
    char text[8];
    snprintf(text, sizeof(text), "%d", mute);
    const char *names[] = {"InstanceID", "Channel", "DesiredMute"};
    const char *values[] = {"0", "Master", text};
    TARN_SEND("SetMute", kRcsType, names, values);
}

int UpnpController::SetNextAVTransportURI(const char *uri, const char *metadata)
{
    if (uri == nullptr) {
        TLOG("Bad parameter.");
        return -1;
    }
    const char *names[] = {"InstanceID", "NextURI", "NextURIMetaData"};
    const char *values[] = {"0", uri, metadata != nullptr ? metadata : ""};
    TARN_SEND("SetNextAVTransportURI", kAvtType, names, values);
}

int UpnpController::Seek(int seconds)
{
    char target[32];
    if (SecondsToTimeString(seconds, target, sizeof(target)) != 0) {
        TLOG("Failed to convert time [%d] to string", seconds);
        return -1;
    }
    const char *names[] = {"InstanceID", "Unit", "Target"};
    const char *values[] = {"0", "REL_TIME", target};
    TARN_SEND("Seek", kAvtType, names, values);
}

#undef TARN_SEND
#undef TARN_SKIP_WHEN_BUSY

namespace {

// The action a request document asks for: its first element's name without
// the namespace prefix ("u:Play" -> "Play").
std::string ActionNameOf(IXML_Document *request)
{
    if (request == nullptr)
        return std::string();
    IXML_Node *node = ixmlNode_getFirstChild(reinterpret_cast<IXML_Node *>(request));
    while (node != nullptr && ixmlNode_getNodeType(node) != eELEMENT_NODE)
        node = ixmlNode_getNextSibling(node);
    if (node == nullptr)
        return std::string();
    const char *name = ixmlNode_getNodeName(node);
    if (name == nullptr)
        return std::string();
    const char *colon = strchr(name, ':');
    return colon != nullptr ? colon + 1 : name;
}

}  // namespace

int UpnpController::OnActionComplete(const UpnpActionComplete *event)
{
    if (event == nullptr) {
        TLOG("Bad parameter");
        return -1;
    }
    ScopedLock lock(this);
    const char *ctrlUrl = UpnpActionComplete_get_CtrlUrl_cstr(event);
    if (ctrlUrl == nullptr)
        return -1;
    size_t index = renderers.size();
    bool avt = false;
    for (size_t i = 0; i < renderers.size(); ++i) {
        const RENDERER_INFO *r = renderers[i];
        if (r == nullptr)
            continue;
        if (r->avt_control_url == ctrlUrl) {
            index = i;
            avt = true;
            break;
        }
        if (r->cms_control_url == ctrlUrl || r->rcs_control_url == ctrlUrl) {
            index = i;
            break;
        }
    }
    if (index == renderers.size() || !avt)
        return -1;
    RENDERER_INFO *renderer = renderers[index];
    if (renderer == nullptr) {
        TLOG("Failed to get renderer with ctrl url [%s]", ctrlUrl);
        return -1;
    }
    int code = UpnpActionComplete_get_ErrCode(event);
    if (renderer->outstanding > 0)
        --renderer->outstanding;
    if (code == UPNP_E_SOCKET_CONNECT) {
        // The renderer no longer takes connections: it is gone. Nothing of
        // its record may be used after this.
        int found = FindRendererByUdn(renderer->udn);
        if (found >= 0)
            RemoveRenderer(static_cast<unsigned>(found));
        TLOG("Action Response not success, [%s]", UpnpGetErrorMessage(code));
        Wake();
        return -1;
    }
    if (code != UPNP_E_SUCCESS)
        TLOG("Action Response not success, [%s]", UpnpGetErrorMessage(code));
    // The answer to the job's action in flight: the next one goes out now.
    if (!renderer->job_sent.empty() &&
        renderer->job_sent == ActionNameOf(UpnpActionComplete_get_ActionRequest(event))) {
        std::string name = renderer->job_sent;
        bool ours = renderer->job_sent_for == renderer->job_id;
        renderer->job_sent.clear();
        if (!ours) {
            // The last action of a job that another one replaced: whatever
            // its answer, the new job goes on.
            SendJobStep(renderer);
        } else if (code != UPNP_E_SUCCESS) {
            renderer->job_steps.clear();
            renderer->job_failed = name;
            renderer->job_error = code;
            renderer->job_done = renderer->job_id;
        } else if (renderer->job_steps.empty()) {
            renderer->job_error = 0;
            renderer->job_done = renderer->job_id;
        } else {
            SendJobStep(renderer);
        }
        if (renderer->job_done == renderer->job_id)
            Wake();
    }
    IXML_Document *result = UpnpActionComplete_get_ActionResult(event);
    if (result == nullptr) {
        TLOG("action result is NULL");
        return -1;
    }
    static const char *const kPositionTags[] = {"u:GetPositionInfoResponse",
                                                 "m:GetPositionInfoResponse"};
    static const char *const kTransportTags[] = {"u:GetTransportInfoResponse",
                                                  "m:GetTransportInfoResponse"};
    for (const char *tag : kPositionTags) {
        IXML_Element *response = XmlGetDocElement(result, tag);
        if (response != nullptr)
            return UpdatePositionInfo(response, renderer);
    }
    for (const char *tag : kTransportTags) {
        IXML_Element *response = XmlGetDocElement(result, tag);
        if (response != nullptr)
            return UpdateTransportInfo(response, renderer);
    }
    return 0;
}

int UpnpController::UpdatePositionInfo(IXML_Element *response, RENDERER_INFO *renderer)
{
    if (response == nullptr || renderer == nullptr) {
        TLOG("Bad parameter");
        return -1;
    }
    std::string text = XmlGetElementChildText(response, "TrackDuration");
    if (!text.empty())
        renderer->duration = TimeStringToSeconds(text.c_str());
    text = XmlGetElementChildText(response, "TrackURI");
    if (!text.empty())
        renderer->current_uri = text;
    text = XmlGetElementChildText(response, "RelTime");
    if (!text.empty())
        renderer->rel_time = TimeStringToSeconds(text.c_str());
    return 0;
}

int UpnpController::UpdateTransportInfo(IXML_Element *response, RENDERER_INFO *renderer)
{
    if (response == nullptr || renderer == nullptr) {
        TLOG("Bad parameter");
        return -1;
    }
    std::string text = XmlGetElementChildText(response, "CurrentTransportState");
    // A renderer that announces its state in events is followed by those:
    // an answer may have been on its way while an event overtook it.
    if (!text.empty() && !renderer->transport_events) {
        renderer->transport_state = text;
        ++renderer->state_reports;
        if (text == "PLAYING")
            ++renderer->playing_reports;
    }
    return 0;
}

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
