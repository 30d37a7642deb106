// The UPnP control point's actions to the selected renderer and the handling
// of their answers.
#include "upnp/upnp.h"

#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "platform/tarn_log.h"
#include "upnp/upnp_internal.h"
#include "upnp/xml_util.h"

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

// The answer to the job's action in flight: the next one goes out now.
// Called under the lock.
void UpnpController::OnJobAnswer(RENDERER_INFO *renderer, const UpnpActionComplete *event, int code)
{
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
}

// Copies a GetPositionInfo or GetTransportInfo answer into the record.
// Called under the lock.
int UpnpController::OnActionResult(IXML_Document *result, RENDERER_INFO *renderer)
{
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
    OnJobAnswer(renderer, event, code);
    return OnActionResult(UpnpActionComplete_get_ActionResult(event), renderer);
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
