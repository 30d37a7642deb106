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

// One action of a renderer job: sent when the one before it succeeded.
struct RendererAction {
    std::string name;
    std::vector<std::string> argNames, argValues;
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

    // The service types as the description names them (any version; the
    // version-1 actions are sent with them).
    std::string avt_type, rcs_type, cms_type;
    // The AVTransport offers SetNextAVTransportURI.
    bool can_set_next = false;
    // NextAVTransportURI as the renderer last announced it.
    std::string next_uri;
    // Transport states that came from the renderer (events or answers), and
    // of those the PLAYING ones: the player tells them from its own writes.
    uint32_t state_reports = 0;
    uint32_t playing_reports = 0;
    // The renderer announces its transport state in events: answers to
    // GetTransportInfo, which may be older, then do not overwrite it.
    bool transport_events = false;
    // Last event key per subscription: an older event handled late is dropped.
    long avt_event_key = -1, rcs_event_key = -1;
    // Requests sent and not answered yet.
    int outstanding = 0;

    // The running job: actions sent one after the other (see StartJob).
    std::vector<RendererAction> job_steps;  // not sent yet
    std::string job_sent;                   // the action waiting for its answer
    uint32_t job_sent_for = 0;              // the job that action belongs to
    uint32_t job_id = 0;                    // the job the steps belong to
    uint32_t job_done = 0;                  // the last job that ended
    int job_error = 0;                      // its result: 0, or the failure code
    std::string job_failed;                 // the action that failed
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
    int SetNextAVTransportURI(const char *uri, const char *metadata);

    // Starts a job on the renderer at `current`: its AVTransport actions are
    // sent in order, each when the one before it was answered with success;
    // a failure ends the job. A job started while another runs replaces the
    // other's unsent actions. Returns the job's id (> 0), or -1 when nothing
    // could be sent. The renderer's job_done and job_error tell the end.
    long StartJob(const std::vector<RendererAction> &steps);
    // Drops the unsent actions of the renderer's job (the job then ends with
    // the answer to the one in flight).
    void CancelJob();
    static RendererAction MakeAction(const char *name, std::vector<std::string> names,
                                     std::vector<std::string> values);

    // Searches with a short MX: devices already on the network answer within
    // a second. Nothing else differs from SearchServers / SearchRenderers.
    int SearchQuick();

    // Called (from any thread, without the lock) when something the main
    // loop acts on arrived: a job ended, a transport state or track changed,
    // a renderer came or went.
    void SetWakeup(void (*fn)()) { wakeup = fn; }

    // Whether a service type names that service (e.g. "AVTransport") in any
    // version from 1 on.
    static bool IsServiceType(const char *type, const char *service);

    static int OnUpnpEvent(Upnp_EventType type, const void *event, void *cookie);

    unsigned RendererCount() const { return static_cast<unsigned>(renderers.size()); }
    unsigned ServerCount() const { return static_cast<unsigned>(servers.size()); }

    // Location URL -> host and port text ("80" when the URL has none).
    static int ParseHttpUrl(const std::string &location, std::string &ip, std::string &port);
    // A service URL of the description resolved against base; "" on failure.
    static std::string ResolveUrl(const std::string &base, const std::string &relative);

private:
    // Discovery and removal: see upnp_discovery.cpp; answers: upnp_actions.cpp;
    // events: upnp_events.cpp.
    friend struct UpnpControllerAccess;  // unit tests of the list rules

    int OnDiscovery(const UpnpDiscovery *event);
    void AddServer(IXML_Document *doc, const char *location);
    void AddRenderer(IXML_Document *doc, const char *location);
    static void ReadRendererServices(IXML_Document *doc, RENDERER_INFO *renderer);
    int OnByeBye(const UpnpDiscovery *event);
    int RemoveServer(unsigned index);
    int RemoveRenderer(unsigned index);
    int OnActionComplete(const UpnpActionComplete *event);
    void OnJobAnswer(RENDERER_INFO *renderer, const UpnpActionComplete *event, int code);
    static int OnActionResult(IXML_Document *result, RENDERER_INFO *renderer);
    static int UpdatePositionInfo(IXML_Element *response, RENDERER_INFO *renderer);
    static int UpdateTransportInfo(IXML_Element *response, RENDERER_INFO *renderer);
    int OnSubscription(const UpnpEventSubscribe *event);
    int OnEventReceived(const UpnpEvent *event);
    static int UpdateFromLastChange(RENDERER_INFO *renderer, const UpnpEvent *event);
    int Search(const char *target, int mx);
    int SendActionTo(RENDERER_INFO *renderer, const char *actionName, const char *serviceType,
                     const char **argNames, const char **argValues, int count);
    void SendJobStep(RENDERER_INFO *renderer);
    void Wake() const
    {
        if (wakeup != nullptr)
            wakeup();
    }

    // Written by the request handler (selection) and by libupnp threads
    // (removal of a renderer), read by the main loop's turn.
    std::atomic<uint32_t> current;
    std::vector<RENDERER_INFO *> renderers;
    std::vector<SERVER_INFO *> servers;
    UpnpClient_Handle client_handle;
    pthread_mutex_t mutex;
    uint32_t lastJobId = 0;
    void (*wakeup)() = nullptr;
};

#endif
