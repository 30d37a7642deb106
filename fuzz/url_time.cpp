// Fuzz target: the small text parsers of the control point and the renderer
// player: location URLs, URL resolution, UPnP time texts, transport state
// names, the search-and-replace helper and the DIDL-Lite metadata of a song
// record.
//
// Byte 0 chooses the parser; the rest is its text (pieces separated by NUL
// bytes where a parser takes two or three texts).
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "daemon/tarn_types.h"
#include "fuzz/fuzz_root.h"
#include "player/upnpplayer.h"
#include "upnp/upnp.h"
#include "upnp/xml_util.h"

namespace {

std::vector<std::string> Pieces(const std::string &text, size_t count)
{
    std::vector<std::string> out;
    size_t at = 0;
    while (out.size() + 1 < count) {
        size_t nul = text.find('\0', at);
        if (nul == std::string::npos)
            break;
        out.push_back(text.substr(at, nul - at));
        at = nul + 1;
    }
    out.push_back(text.substr(at));
    while (out.size() < count)
        out.push_back("");
    return out;
}

bool Printable(const char *p, size_t n)
{
    for (size_t i = 0; i < n && p[i] != '\0'; i++) {
        if (p[i] < 0x20 || p[i] > 0x7e)
            return false;
    }
    return true;
}

void Fail(const char *what, const std::string &detail)
{
    fprintf(stderr, "url_time: %s: [%s]\n", what, detail.c_str());
    abort();
}

}  // namespace

// ixml itself leaks the text node it was building when a document breaks off
// after its root element (reproduced with a plain ixmlParseBufferEx call);
// nothing of ours creates text nodes.
extern "C" const char *__lsan_default_suppressions()
{
    return "leak:ixmlDocument_createTextNodeEx\n";
}

extern "C" int LLVMFuzzerInitialize(int *, char ***)
{
    FuzzMakeRoot();
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size)
{
    if (size < 1 || size > 16384)
        return 0;
    int mode = data[0] % 6;
    std::string text(reinterpret_cast<const char *>(data + 1), size - 1);
    switch (mode) {
    case 0: {
        std::string ip = "unset", port = "unset";
        if (UpnpController::ParseHttpUrl(text, ip, port) == 0) {
            // Host and port are pieces of the location itself.
            if (text.find(ip) == std::string::npos || (port != "80" && text.find(port) == std::string::npos))
                Fail("host or port not from the location", text);
        }
        break;
    }
    case 1: {
        std::vector<std::string> p = Pieces(text, 2);
        std::string r = UpnpController::ResolveUrl(p[0], p[1]);
        if (r.find('\0') != std::string::npos)
            Fail("resolved URL holds a NUL", r);
        break;
    }
    case 2: {
        std::string t(text.c_str());
        int s = TimeStringToSeconds(t.c_str());
        (void)s;
        if (text.size() >= 4) {
            int32_t v;
            memcpy(&v, text.data(), sizeof(v));
            char buf[64];
            int rc = SecondsToTimeString(v, buf, sizeof(buf));
            if (v < 0 && rc == 0)
                Fail("negative seconds formatted", std::to_string(v));
            if (v >= 0) {
                if (rc != 0)
                    Fail("seconds not formatted", std::to_string(v));
                if (TimeStringToSeconds(buf) != v)
                    Fail("time text does not read back", buf);
            }
            // A short buffer is cut, never overrun.
            char small[6];
            SecondsToTimeString(v, small, static_cast<int>(sizeof(small)));
        }
        break;
    }
    case 3: {
        std::string t(text.c_str());
        int state = UpnpPlayer::StateFromText(t);
        if (state < 0 || state > 4)
            Fail("state out of range", t);
        break;
    }
    case 4: {
        std::vector<std::string> p = Pieces(text, 3);
        std::string s = p[0];
        if (p[1].empty())
            break;
        // Each match is replaced once: the text grows by at most the
        // replacement per character of the original.
        StringReplaceAll(s, p[1], p[2]);
        if (s.size() > p[0].size() * (p[2].size() + 1))
            Fail("replacement grew without bound", s.substr(0, 200));
        break;
    }
    default: {
        // A song record (the input, zero-padded) and a URL after it.
        TARN_MEDIA_INFO song;
        memset(&song, 0, sizeof(song));
        memcpy(&song, text.data(), text.size() < sizeof(song) ? text.size() : sizeof(song));
        std::string url;
        if (text.size() > sizeof(song))
            url = std::string(text.c_str() + sizeof(song)).substr(0, 512);
        std::string didl;
        if (BuildDidlMetadata(&song, url.c_str(), didl) != 0)
            break;
        // Printable texts must give a well-formed document. The URL is
        // written into the res element as it is (by design), so only URLs
        // without markup characters are held to this.
        if (Printable(song.title, sizeof(song.title)) && Printable(song.album, sizeof(song.album)) &&
            Printable(song.artist, sizeof(song.artist)) &&
            Printable(song.genre, sizeof(song.genre)) && Printable(url.c_str(), url.size()) &&
            url.find_first_of("<>&") == std::string::npos) {
            IXML_Document *doc = nullptr;
            if (ixmlParseBufferEx(didl.c_str(), &doc) != IXML_SUCCESS)
                Fail("metadata is no XML", didl);
            ixmlDocument_free(doc);
        }
        break;
    }
    }
    return 0;
}
