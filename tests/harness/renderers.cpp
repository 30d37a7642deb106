#include "tests/harness/renderers.h"

#include <sys/stat.h>

#include <cstdlib>

#include "tests/harness/harness.h"

namespace tarntest {

const char *RendererProgram(const std::string &kind)
{
    if (kind == "gmediarender")
        return "/usr/bin/gmediarender";
    if (kind == "rygel")
        return "/usr/bin/rygel";
    return nullptr;
}

static pid_t StartRygel(Harness &h, const std::string &iface, const std::string &name)
{
    std::string home = h.Path("/rygel");
    for (const char *sub : {"", "/config", "/cache", "/data"})
        mkdir((home + sub).c_str(), 0755);
    std::string conf = "[general]\nipv6=false\nenable-transcoding=false\ninterface=" + iface +
                       "\nport=49600\nlog-level=*:3\nallow-upload=false\nallow-deletion=false\n"
                       "acl-fallback-policy=true\nmedia-engine=librygel-media-engine-gst.so\n";
    for (const char *off : {"Tracker3", "Tracker", "LMS", "MediaExport", "External", "MPRIS", "GstLaunch"})
        conf += std::string("[") + off + "]\nenabled=false\n";
    conf += "[Playbin]\nenabled=true\ntitle=" + name + "\naudio-sink=fakesink sync=true\n";
    if (h.WriteFile("/rygel/config/rygel.conf", conf) != 0)
        return -1;
    // The child takes the environment as it is when it starts.
    setenv("XDG_CONFIG_HOME", (home + "/config").c_str(), 1);
    setenv("XDG_CACHE_HOME", (home + "/cache").c_str(), 1);
    setenv("XDG_DATA_HOME", (home + "/data").c_str(), 1);
    pid_t pid = h.Spawn({"/usr/bin/rygel", "-c", home + "/config/rygel.conf", "-n", iface, "-p", "49600", "-d",
                         "MediaExport"});
    for (const char *var : {"XDG_CONFIG_HOME", "XDG_CACHE_HOME", "XDG_DATA_HOME"})
        unsetenv(var);
    return pid;
}

pid_t StartRenderer(Harness &h, const std::string &kind, const std::string &iface, const std::string &name,
                    const std::string &udn)
{
    if (kind == "gmediarender")
        return h.Spawn({"/usr/bin/gmediarender", "-I", iface, "-p", "49494", "-f", name, "-u", udn,
                        "--gstout-audiopipe", "fakesink sync=true", "--logfile", h.Path("/tmp/gmediarender.log")});
    if (kind == "rygel")
        return StartRygel(h, iface, name);
    return -1;
}

}  // namespace tarntest
