// Whether a renderer can seek by play time and set its volume, read from
// its service descriptions when it is found.
#ifndef TARN_GET_CAPABILITY_H
#define TARN_GET_CAPABILITY_H

#include "upnp/upnp_sdk.h"

struct RENDERER_INFO;

// Sets renderer->can_seek and renderer->can_set_volume. 0, or -1 when an
// argument is missing or a service description could not be downloaded
// (both flags then stay false).
int GetRendererCapability(IXML_Document *description, RENDERER_INFO *renderer);

// True for the one renderer model that is listed as capable of neither
// without asking it (both flags are cleared).
bool IsLimitedModel(IXML_Document *description, RENDERER_INFO *renderer);

// AVTransport description: a "Seek" action and "REL_TIME" among the allowed
// values of A_ARG_TYPE_SeekMode.
bool SupportsRelTimeSeek(IXML_Document *scpd);

// A service description lists that action.
bool SupportsAction(IXML_Document *scpd, const char *action);

// RenderingControl description: a "SetVolume" action.
bool SupportsSetVolume(IXML_Document *scpd);

#endif
