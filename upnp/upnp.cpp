// The daemon's UPnP control point: finds media servers and renderers, keeps
// their lists, sends actions to the selected renderer and copies what the
// renderers answer and announce into their records.
//
// libupnp calls OnUpnpEvent on its own worker threads; everything those
// threads touch (both lists and every record in them) is guarded by one plain
// mutex. The main loop takes the same mutex around its turn over the
// renderer players, and every action is sent from inside that turn.
//
// This file: start and stop, searches and URLs. Discovery and the device
// lists are in upnp_discovery.cpp, actions and their answers in
// upnp_actions.cpp, subscriptions and events in upnp_events.cpp.
#include "upnp/upnp.h"

#include <cstdio>
#include <cstdlib>
#include <cstring>

#include <curl/curl.h>

#include "platform/tarn_log.h"
#include "upnp/upnp_internal.h"
#include "upnp/xml_util.h"


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
