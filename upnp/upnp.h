// The daemon's UPnP control point: server and renderer lists, renderer
// actions, events.
#ifndef TARN_UPNP_H
#define TARN_UPNP_H

#include <pthread.h>
#include <atomic>
#include <cstdint>
#include <string>
#include <vector>

#include <json/json.h>
#include "upnp/upnp_sdk.h"

struct SERVER_INFO {
    std::string udn;
    std::string ip;
    std::string port;
    std::string base_url;
    std::string friendly_name;
    std::string cds_control_url;
};

struct RENDERER_INFO {
    std::string udn;
    std::string ip;
    std::string port;
    std::string base_url;
    std::string friendly_name;
    std::string avt_control_url, rcs_control_url, cms_control_url;
    std::string avt_event_url, rcs_event_url, cms_event_url;
    std::string avt_scpd_url, rcs_scpd_url, cms_scpd_url;
    std::string avt_sid, rcs_sid, cms_sid;
    std::string current_uri;
    int32_t duration = 0;
    int32_t rel_time = 0;
    std::string transport_state;
    std::string volume;
    std::string mute;
    std::string spare;
    bool can_seek = false;
    bool can_set_volume = false;
};

class UpnpController {
public:
    UpnpController();
    ~UpnpController();
    UpnpController(const UpnpController &) = delete;
    UpnpController &operator=(const UpnpController &) = delete;

    int Init();
    int Uninit();
    int SearchServers();
    int SearchRenderers();
    int Search(const char *target);
    // ClearList and Refresh take the lock themselves. Every other operation
    // below (lists, selection, lookups, actions) expects the caller to hold
    // it: the mutex is not recursive.
    int ClearList(const char *kind);
    int Refresh(const char *kind);
    int GetServerList(Json::Value &reply, int start, int limit);
    int GetRendererList(Json::Value &reply, int start, int limit);
    int GetRendererState(Json::Value &reply);
    int SelectRenderer(unsigned index);
    int GetRenderer(unsigned index, RENDERER_INFO **out);
    int GetCurrentRenderer(RENDERER_INFO **out);
    int FindRendererByUdn(const std::string &udn);
    int FindServerByUdn(const std::string &udn);
    void Lock();
    void Unlock();

    // Renderer actions, sent to the renderer at `current`.
    int SetAVTransportURI(const char *uri, const char *metadata);
    int GetPositionInfo();
    int GetTransportInfo();
    int Play();
    int Pause();
    int Stop();
    int SetVolume(int volume);
    int SetMute(int mute);
    int Seek(int seconds);
    int SendAction(const char *actionName, const char *serviceType,
                   const char **argNames, const char **argValues, int count);

    static int OnUpnpEvent(Upnp_EventType type, const void *event, void *cookie);

    unsigned RendererCount() const { return static_cast<unsigned>(renderers.size()); }
    unsigned ServerCount() const { return static_cast<unsigned>(servers.size()); }

    // Location URL -> host and port text ("80" when the URL has none).
    static int ParseHttpUrl(const std::string &location, std::string &ip, std::string &port);
    // A service URL of the description resolved against base; "" on failure.
    static std::string ResolveUrl(const std::string &base, const std::string &relative);

private:
    // Discovery, removal, answers and events: see upnp.cpp.
    friend struct UpnpControllerAccess;  // unit tests of the list rules

    int OnDiscovery(const UpnpDiscovery *event);
    void AddServer(IXML_Document *doc, const char *location);
    void AddRenderer(IXML_Document *doc, const char *location);
    int OnByeBye(const UpnpDiscovery *event);
    int RemoveServer(unsigned index);
    int RemoveRenderer(unsigned index);
    int OnActionComplete(const UpnpActionComplete *event);
    static int UpdatePositionInfo(IXML_Element *response, RENDERER_INFO *renderer);
    static int UpdateTransportInfo(IXML_Element *response, RENDERER_INFO *renderer);
    int OnSubscription(const UpnpEventSubscribe *event);
    int OnEventReceived(const UpnpEvent *event);
    static int UpdateFromLastChange(RENDERER_INFO *renderer, const UpnpEvent *event);

    // Written by the request handler (selection) and by libupnp threads
    // (removal of a renderer), read by the main loop's turn.
    std::atomic<uint32_t> current;
    std::vector<RENDERER_INFO *> renderers;
    std::vector<SERVER_INFO *> servers;
    UpnpClient_Handle client_handle;
    pthread_mutex_t mutex;
};

#endif
