// Shared by the files of the UPnP control point (upnp.cpp, upnp_discovery.cpp,
// upnp_actions.cpp, upnp_events.cpp): service types, limits and the scoped
// lock of the controller's mutex. Not for use outside upnp/.
#ifndef TARN_UPNP_INTERNAL_H
#define TARN_UPNP_INTERNAL_H

#include <cstdint>

#include "upnp/upnp.h"

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

#endif
