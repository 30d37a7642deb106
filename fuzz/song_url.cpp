// Fuzz target: what the song server decodes from a request URL: song-id
// tokens and signed path tokens.
//
// Byte 0 chooses the decoder. Checked: a token that decodes gives back the
// same token when the id is encoded again (so no two texts name one song),
// tokens of ids made from the input always decode to that id; a path token
// that decodes is exactly the token of the decoded path (no second spelling
// and no unsigned text is accepted), and the token of any path decodes back
// to that path.
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <strings.h>

#include "fuzz/fuzz_root.h"
#include "platform/media_id.h"

extern "C" int LLVMFuzzerInitialize(int *, char ***)
{
    FuzzMakeRoot();  // the installation's secret lives in the root
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size)
{
    if (size < 1 || size > 8192)
        return 0;
    int mode = data[0] % 2;
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
    default: {
        std::string path = "unset";
        std::string token(text.c_str());
        if (MediaPathTokenDecode(token.c_str(), &path) == 0 && MediaPathToken(path) != token) {
            fprintf(stderr, "song_url: path token [%s] accepted for [%s]\n", token.c_str(),
                    path.c_str());
            abort();
        }
        std::string own(text.c_str());
        if (!own.empty()) {
            std::string back;
            if (MediaPathTokenDecode(MediaPathToken(own).c_str(), &back) != 0 || back != own) {
                fprintf(stderr, "song_url: path [%s] does not survive its token\n", own.c_str());
                abort();
            }
        }
        break;
    }
    }
    return 0;
}
