// Renderer capability probe: the RenderingControl and AVTransport service
// descriptions of a newly found renderer decide its "seek" and "set_volume".
#include "upnp/get_capability.h"

#include <cstring>

#include "upnp/upnp_sdk.h"

#include "platform/tarn_log.h"
#include "upnp/upnp.h"
#include "upnp/xml_util.h"

static const char kLogUnit[] = "get_capability";

bool IsLimitedModel(IXML_Document *description, RENDERER_INFO *renderer)
{
    if (description == nullptr || renderer == nullptr) {
        TLOG("Bad parameter");
        return false;
    }
    if (XmlGetDocElementText(description, "modelName") != "WD TV HD Live")
        return false;
    renderer->can_seek = false;
    renderer->can_set_volume = false;
    return true;
}

bool SupportsRelTimeSeek(IXML_Document *scpd)
{
    if (scpd == nullptr) {
        TLOG("Bad parameter");
        return false;
    }
    IXML_Element *actions = XmlGetDocElement(scpd, "actionList");
    if (actions == nullptr)
        return false;
    if (XmlFindItemByChildText(actions, "action", "name", "Seek") == nullptr)
        return false;
    IXML_Element *table = XmlGetDocElement(scpd, "serviceStateTable");
    if (table == nullptr)
        return false;
    IXML_Element *mode =
        XmlFindItemByChildText(table, "stateVariable", "name", "A_ARG_TYPE_SeekMode");
    if (mode == nullptr)
        return false;
    return XmlHasChildWithText(mode, "allowedValue", "REL_TIME");
}

bool SupportsAction(IXML_Document *scpd, const char *action)
{
    if (scpd == nullptr || action == nullptr) {
        TLOG("Bad parameter");
        return false;
    }
    IXML_Element *actions = XmlGetDocElement(scpd, "actionList");
    if (actions == nullptr)
        return false;
    return XmlFindItemByChildText(actions, "action", "name", action) != nullptr;
}

bool SupportsSetVolume(IXML_Document *scpd)
{
    return SupportsAction(scpd, "SetVolume");
}

int GetRendererCapability(IXML_Document *description, RENDERER_INFO *renderer)
{
    if (renderer != nullptr) {
        renderer->can_seek = false;
        renderer->can_set_volume = false;
        renderer->can_set_next = false;
    }
    if (description == nullptr || renderer == nullptr) {
        TLOG("Bad parameter");
        return -1;
    }
    if (IsLimitedModel(description, renderer))
        return 0;

    IXML_Document *rcsDoc = nullptr;
    int rc = XmlDownloadDoc(renderer->rcs_scpd_url.c_str(), &rcsDoc);
    if (rc != UPNP_E_SUCCESS || rcsDoc == nullptr) {
        TLOG("Failed to download RCS SCPD xml, url [%s], rc[%d], msg[%s]",
             renderer->rcs_scpd_url.c_str(), rc, UpnpGetErrorMessage(rc));
        if (rcsDoc != nullptr)
            ixmlDocument_free(rcsDoc);
        return -1;
    }
    IXML_Document *avtDoc = nullptr;
    rc = XmlDownloadDoc(renderer->avt_scpd_url.c_str(), &avtDoc);
    if (rc != UPNP_E_SUCCESS || avtDoc == nullptr) {
        TLOG("Failed to download AVT SCPD xml, url [%s], rc[%d], msg[%s]",
             renderer->avt_scpd_url.c_str(), rc, UpnpGetErrorMessage(rc));
        ixmlDocument_free(rcsDoc);
        if (avtDoc != nullptr)
            ixmlDocument_free(avtDoc);
        return -1;
    }
    renderer->can_seek = SupportsRelTimeSeek(avtDoc);
    renderer->can_set_next = SupportsAction(avtDoc, "SetNextAVTransportURI");
    renderer->can_set_volume = SupportsSetVolume(rcsDoc);
    ixmlDocument_free(rcsDoc);
    ixmlDocument_free(avtDoc);
    return 0;
}
