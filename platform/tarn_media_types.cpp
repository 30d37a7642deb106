#include "platform/tarn_media_types.h"

#include <strings.h>

#include <cstdio>
#include <cstring>
#include <string>

#include "platform/tarn_env.h"
#include "platform/tlibc_conf.h"

namespace {

struct MediaType {
    const char *ext;
    const char *mime;
};

// Every type the players can play, plus "txt", which stands for files of an
// unknown type.
const MediaType kMediaTypes[] = {
    {"mp3", "audio/mpeg"},
    {"m4a", "audio/mp4"},
    {"ogg", "audio/ogg"},
    {"aac", "audio/aac"},
    {"wma", "audio/x-ms-wma"},
    {"flac", "audio/flac"},
    {"aiff", "audio/aiff"},
    {"aif", "audio/aiff"},
    {"mp1", "audio/mpeg"},
    {"mp2", "audio/mpeg"},
    {"mpa", "audio/mpeg"},
    {"wav", "audio/wav"},
    {"ac3", "audio/ac3"},
    {"ra", "audio/vnd.rn-realaudio"},
    {"ram", "audio/x-pn-realaudio"},
    {"m4p", "audio/mp4"},
    {"m4b", "audio/mp4"},
    {"ape", "audio/x-ape"},
    // Also indexed by the media library, played by renderers that know them.
    {"oga", "audio/ogg"},
    {"opus", "audio/ogg"},
    {"mpc", "audio/x-musepack"},
    {"wv", "audio/x-wavpack"},
    {"txt", "text/plain"},
};

const MediaType *FindType(const char *ext)
{
    if (!ext || !*ext)
        return nullptr;
    for (const MediaType &t : kMediaTypes) {
        if (strcasecmp(t.ext, ext) == 0)
            return &t;
    }
    return nullptr;
}

}  // namespace

const char *TARNIndexExtGet(const char *path)
{
    if (!path)
        return nullptr;
    const char *slash = strrchr(path, '/');
    const char *name = slash ? slash + 1 : path;
    const char *dot = strrchr(name, '.');
    if (!dot || dot[1] == '\0')
        return nullptr;
    const MediaType *t = FindType(dot + 1);
    return t ? t->ext : nullptr;
}

int TARNAudioGetMimetype(const char *ext, char *buffer, size_t size)
{
    if (buffer && size > 0)
        buffer[0] = '\0';
    if (!buffer || size == 0)
        return -1;
    const MediaType *t = FindType(ext);
    if (!t || strlen(t->mime) >= size)
        return -1;
    snprintf(buffer, size, "%s", t->mime);
    return 0;
}

int TARNAudioUSBMountRoot(char *buffer, size_t size)
{
    if (!buffer || size == 0)
        return -1;
    char value[4096] = "";
    std::string root;
    std::string conf = TarnPath(TARN_INFO_CONF);
    if (TLIBCFileGetKeyValue(conf.c_str(), "usb_mount_root", value, sizeof(value), 0) > 0)
        root = value;
    else
        root = TarnPath("/media/usb");
    while (root.size() > 1 && root.back() == '/')
        root.pop_back();
    if (root.size() >= size)
        return -1;
    snprintf(buffer, size, "%s", root.c_str());
    return 0;
}

int TARNAudioIsUSBVolume(const char *path)
{
    if (!path || !*path)
        return -1;
    char root[4096];
    if (TARNAudioUSBMountRoot(root, sizeof(root)) != 0)
        return 0;
    if (strcmp(root, "/") == 0)
        return path[0] == '/' ? 1 : 0;
    size_t n = strlen(root);
    if (strncmp(path, root, n) != 0)
        return 0;
    return (path[n] == '\0' || path[n] == '/') ? 1 : 0;
}
