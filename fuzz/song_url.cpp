// Fuzz target: what the song server decodes from a request URL: song-id
// tokens, hex-coded USB paths and the check that a path lies inside the USB
// root.
//
// Byte 0 chooses the decoder. Checked: a token that decodes gives back the
// same token when the id is encoded again (so no two texts name one song),
// tokens of ids made from the input always decode to that id, hex decoding
// gives half as many bytes and no NUL, and a path accepted as inside the
// root really starts with the root.
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <strings.h>

#include "fuzz/fuzz_root.h"
#include "platform/media_id.h"
#include "tools/tarnweb/song_server.h"

namespace {
std::string g_usb;
}

extern "C" int LLVMFuzzerInitialize(int *, char ***)
{
    std::string root = FuzzMakeRoot();
    g_usb = root + "/usb";
    mkdir(g_usb.c_str(), 0755);
    mkdir((g_usb + "/sda1").c_str(), 0755);
    FILE *fp = fopen((g_usb + "/sda1/song.mp3").c_str(), "w");
    if (fp)
        fclose(fp);
    symlink("/etc", (g_usb + "/sda1/out").c_str());
    symlink("..", (g_usb + "/sda1/up").c_str());
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size)
{
    if (size < 1 || size > 8192)
        return 0;
    int mode = data[0] % 3;
    std::string text(reinterpret_cast<const char *>(data + 1), size - 1);
    switch (mode) {
    case 0: {
        uint32_t id = 0;
        std::string token(text.c_str());
        if (MediaIDDecryption(token.c_str(), &id) == 0) {
            std::string again = MediaIDEncryption(id);
            if (strcasecmp(again.c_str(), token.c_str()) != 0) {
                fprintf(stderr, "song_url: token [%s] decodes to %u, which encodes as [%s]\n",
                        token.c_str(), id, again.c_str());
                abort();
            }
        }
        if (text.size() >= 4) {
            uint32_t v;
            memcpy(&v, text.data(), sizeof(v));
            std::string t = MediaIDEncryption(v);
            uint32_t back = v + 1;
            if (t.size() != MEDIA_ID_TOKEN_LEN || MediaIDDecryption(t.c_str(), &back) != 0 ||
                back != v) {
                fprintf(stderr, "song_url: id %u does not survive its token [%s]\n", v, t.c_str());
                abort();
            }
        }
        break;
    }
    case 1: {
        std::string out = "unset";
        if (SongServerDecodeHex(text, &out) == 0) {
            if (out.size() * 2 != text.size() || out.find('\0') != std::string::npos) {
                fprintf(stderr, "song_url: hex [%s] decoded to %zu bytes\n", text.c_str(),
                        out.size());
                abort();
            }
        }
        break;
    }
    default: {
        std::string path = g_usb + "/" + std::string(text.c_str());
        std::string resolved;
        if (SongServerResolveInside(path, g_usb, &resolved) == 0) {
            if (resolved.compare(0, g_usb.size(), g_usb) != 0 ||
                (resolved.size() > g_usb.size() && resolved[g_usb.size()] != '/')) {
                fprintf(stderr, "song_url: [%s] resolved to [%s], outside [%s]\n", path.c_str(),
                        resolved.c_str(), g_usb.c_str());
                abort();
            }
        }
        break;
    }
    }
    return 0;
}
