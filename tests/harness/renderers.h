// The real UPnP renderers the daemon is tried with, started as children of
// the harness inside its private network: gmediarender, and rygel with its
// Playbin renderer (which describes later service versions). Both play into
// a fakesink that keeps real time.
#ifndef TARN_TEST_RENDERERS_H
#define TARN_TEST_RENDERERS_H

#include <sys/types.h>

#include <string>

namespace tarntest {

class Harness;

// "gmediarender" or "rygel": its program, null for another kind.
const char *RendererProgram(const std::string &kind);

// Starts the renderer of that kind on iface with the friendly name: its pid,
// -1 when it could not be started. gmediarender listens on port 49494 with
// the UDN given and logs to <root>/tmp/gmediarender.log; rygel listens on
// port 49600 with its own configuration and XDG folders under <root>/rygel
// (it makes its UDN once and keeps it there; udn is not used).
pid_t StartRenderer(Harness &h, const std::string &kind, const std::string &iface, const std::string &name,
                    const std::string &udn);

}  // namespace tarntest

#endif
