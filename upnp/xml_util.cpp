// Text helpers over ixml documents, XML escaping, UPnP time texts and the
// DIDL-Lite metadata that goes with SetAVTransportURI.
#include "upnp/xml_util.h"

#include <atomic>
#include <cstdio>
#include <cstring>

#include <sys/utsname.h>

#include "upnp/upnp_sdk.h"

#include "platform/http_fetch.h"
#include "platform/tarn_log.h"
#include "platform/tarn_media_types.h"

static const char kLogUnit[] = "xml_util";
// The metadata builder reports as part of the renderer player.
static const char kDidlLogUnit[] = "upnpplayer";

// ---------------------------------------------------------------------------
// Reading element text.

std::string XmlGetNodeText(IXML_Node *node)
{
    if (node == nullptr)
        return std::string();
    IXML_Node *child = ixmlNode_getFirstChild(node);
    if (child == nullptr || ixmlNode_getNodeType(child) != eTEXT_NODE)
        return std::string();
    const char *value = ixmlNode_getNodeValue(child);
    return value != nullptr ? std::string(value) : std::string();
}

std::string XmlGetDocElementText(IXML_Document *doc, const char *tag)
{
    if (doc == nullptr || tag == nullptr) {
        TLOG("Bad parameter");
        return std::string();
    }
    IXML_NodeList *list = ixmlDocument_getElementsByTagName(doc, tag);
    if (list == nullptr)
        return std::string();
    std::string text = XmlGetNodeText(ixmlNodeList_item(list, 0));
    ixmlNodeList_free(list);
    return text;
}

std::string XmlGetElementChildText(IXML_Element *element, const char *tag)
{
    if (element == nullptr || tag == nullptr)
        return std::string();
    IXML_NodeList *list = ixmlElement_getElementsByTagName(element, tag);
    if (list == nullptr)
        return std::string();
    std::string text = XmlGetNodeText(ixmlNodeList_item(list, 0));
    ixmlNodeList_free(list);
    return text;
}

IXML_Element *XmlGetDocElement(IXML_Document *doc, const char *tag)
{
    if (doc == nullptr || tag == nullptr)
        return nullptr;
    IXML_NodeList *list = ixmlDocument_getElementsByTagName(doc, tag);
    if (list == nullptr)
        return nullptr;
    IXML_Element *element = reinterpret_cast<IXML_Element *>(ixmlNodeList_item(list, 0));
    ixmlNodeList_free(list);
    return element;
}

std::string XmlGetDocElementVal(IXML_Document *doc, const char *tag)
{
    if (doc == nullptr || tag == nullptr) {
        TLOG("Bad parameter");
        return std::string();
    }
    IXML_Element *element = XmlGetDocElement(doc, tag);
    if (element == nullptr)
        return std::string();
    const char *val = ixmlElement_getAttribute(element, "val");
    return val != nullptr ? std::string(val) : std::string();
}

IXML_Element *XmlFindItemByChildText(IXML_Element *parent, const char *itemTag,
                                     const char *childTag, const char *value)
{
    if (parent == nullptr || itemTag == nullptr || childTag == nullptr || value == nullptr) {
        TLOG("Bad parameter");
        return nullptr;
    }
    IXML_NodeList *items = ixmlElement_getElementsByTagName(parent, itemTag);
    if (items == nullptr)
        return nullptr;
    IXML_Element *found = nullptr;
    unsigned long count = ixmlNodeList_length(items);
    for (unsigned long i = 0; i < count && found == nullptr; ++i) {
        IXML_Element *item = reinterpret_cast<IXML_Element *>(ixmlNodeList_item(items, i));
        if (XmlGetElementChildText(item, childTag) == value)
            found = item;
    }
    ixmlNodeList_free(items);
    return found;
}

bool XmlHasChildWithText(IXML_Element *element, const char *tag, const char *value)
{
    if (element == nullptr || tag == nullptr || value == nullptr) {
        TLOG("Bad parameter");
        return false;
    }
    IXML_NodeList *list = ixmlElement_getElementsByTagName(element, tag);
    if (list == nullptr)
        return false;
    bool found = false;
    unsigned long count = ixmlNodeList_length(list);
    for (unsigned long i = 0; i < count && !found; ++i)
        found = XmlGetNodeText(ixmlNodeList_item(list, i)) == value;
    ixmlNodeList_free(list);
    return found;
}

// ---------------------------------------------------------------------------
// Text.

std::string XmlEscape(const std::string &text)
{
    std::string out;
    out.reserve(text.size() + 16);
    for (char c : text) {
        switch (c) {
        case '"': out += "&quot;"; break;
        case '<': out += "&lt;"; break;
        case '>': out += "&gt;"; break;
        case '\'': out += "&apos;"; break;
        case '&': out += "&amp;"; break;
        default: out += c; break;
        }
    }
    return out;
}

void StringReplaceAll(std::string &text, const std::string &from, const std::string &to)
{
    if (from.empty())
        return;
    size_t pos = 0;
    while ((pos = text.find(from, pos)) != std::string::npos) {
        text.replace(pos, from.size(), to);
        pos += to.size();
    }
}

int TimeStringToSeconds(const char *text)
{
    if (text == nullptr) {
        TLOG("Bad parameter");
        return -1;
    }
    if (text[0] == '\0')
        return -1;
    int hours = 0, minutes = 0, seconds = 0;
    if (sscanf(text, "%d:%d:%d", &hours, &minutes, &seconds) != 3)
        return -1;
    // Unsigned arithmetic: absurd renderer texts wrap instead of overflowing.
    return static_cast<int>(static_cast<unsigned>(hours) * 3600u +
                            static_cast<unsigned>(minutes) * 60u +
                            static_cast<unsigned>(seconds));
}

int SecondsToTimeString(int seconds, char *buffer, int size)
{
    if (buffer == nullptr || size <= 0) {
        TLOG("Bad parameter");
        return -1;
    }
    if (seconds < 0)
        return -1;
    snprintf(buffer, static_cast<size_t>(size), "%d:%02d:%02d.000", seconds / 3600,
             (seconds % 3600) / 60, seconds % 60);
    return 0;
}

// Appends one element, printed into a 4096-byte buffer first so that an
// element longer than 4095 bytes is cut there.
static void AppendPiece(std::string &out, const char *fmt, const char *a, const char *b = nullptr,
                        const char *c = nullptr)
{
    char piece[4096];
    snprintf(piece, sizeof(piece), fmt, a, b, c);
    out += piece;
}

int BuildDidlMetadata(const TARN_MEDIA_INFO *song, const char *url, std::string &out)
{
    if (song == nullptr) {
        TarnLog("%s:%d Bad parameters.", kDidlLogUnit, __LINE__);
        return -1;
    }
    // The record's texts are fixed-size fields; never read past them.
    std::string path(song->path, strnlen(song->path, sizeof(song->path)));
    std::string title(song->title, strnlen(song->title, sizeof(song->title)));
    std::string album(song->album, strnlen(song->album, sizeof(song->album)));
    std::string artist(song->artist, strnlen(song->artist, sizeof(song->artist)));
    std::string genre(song->genre, strnlen(song->genre, sizeof(song->genre)));

    const char *ext = TARNIndexExtGet(path.c_str());
    if (ext == nullptr || ext[0] == '\0')
        ext = "txt";
    char mime[64];
    if (TARNAudioGetMimetype(ext, mime, sizeof(mime)) != 0) {
        TarnLog("%s:%d Failed to get mime type", kDidlLogUnit, __LINE__);
        return -1;
    }
    float durationF = song->duration;
    int duration = -1;
    if (durationF == durationF && durationF > -2147483648.0f && durationF < 2147483648.0f)
        duration = static_cast<int>(durationF);
    char durationText[32];
    if (SecondsToTimeString(duration, durationText, sizeof(durationText)) != 0) {
        TarnLog("%s:%d Failed to convert time [%d] to string", kDidlLogUnit, __LINE__, duration);
        return -1;
    }

    std::string didl =
        "<DIDL-Lite xmlns=\"urn:schemas-upnp-org:metadata-1-0/DIDL-Lite/\" "
        "xmlns:dc=\"http://purl.org/dc/elements/1.1/\" "
        "xmlns:upnp=\"urn:schemas-upnp-org:metadata-1-0/upnp/\"><item>";
    std::string escapedArtist = XmlEscape(artist);
    AppendPiece(didl, "<dc:title>%s</dc:title>", XmlEscape(title).c_str());
    AppendPiece(didl, "<dc:creator>%s</dc:creator>", escapedArtist.c_str());
    AppendPiece(didl, "<res duration=\"%s\" protocolInfo=\"http-get:*:%s:*\">%s</res>",
                durationText, mime, url != nullptr ? url : "");
    AppendPiece(didl, "<upnp:album>%s</upnp:album>", XmlEscape(album).c_str());
    AppendPiece(didl, "<upnp:artist>%s</upnp:artist>", escapedArtist.c_str());
    char track[128];
    snprintf(track, sizeof(track), "<upnp:originalTrackNumber>%d</upnp:originalTrackNumber>",
             song->track);
    didl += track;
    AppendPiece(didl, "<upnp:genre>%s</upnp:genre>", XmlEscape(genre).c_str());
    AppendPiece(didl, "<upnp:class>%s</upnp:class>", "object.item.audioItem.musicTrack");
    didl += "</item></DIDL-Lite>";
    out.swap(didl);
    return 0;
}

// ---------------------------------------------------------------------------
// Guarded parsing and downloading.

int XmlCheckLimits(const char *text, size_t length)
{
    if (text == nullptr || length > kXmlMaxDocumentBytes)
        return -1;
    // A rough scan of the markup: start tags open a level, end tags and
    // empty-element tags close it; declarations, comments and processing
    // instructions count as items only. Anything the scan misjudges is still
    // bounded by the item count.
    int depth = 0;
    int items = 0;
    for (size_t i = 0; i < length; ++i) {
        if (text[i] != '<')
            continue;
        if (++items > kXmlMaxNodes)
            return -1;
        size_t end = i + 1;
        while (end < length && text[end] != '>')
            ++end;
        char next = i + 1 < length ? text[i + 1] : '\0';
        if (next == '/') {
            if (depth > 0)
                --depth;
        } else if (next != '?' && next != '!') {
            bool selfClosing = end < length && end > i + 1 && text[end - 1] == '/';
            if (!selfClosing && ++depth > kXmlMaxDepth)
                return -1;
        }
        i = end;
    }
    return 0;
}

int XmlParseGuarded(const char *text, IXML_Document **doc)
{
    if (doc == nullptr)
        return IXML_INVALID_PARAMETER;
    *doc = nullptr;
    if (text == nullptr)
        return IXML_INVALID_PARAMETER;
    if (XmlCheckLimits(text, strlen(text)) != 0)
        return IXML_INSUFFICIENT_MEMORY;
    return ixmlParseBufferEx(text, doc);
}

namespace {

// Set while the control point shuts down: running downloads give up.
std::atomic<bool> g_abortDownloads{false};

}  // namespace

const char *XmlUserAgent()
{
    // The text libupnp puts in its own requests: "<OS>/<release>, UPnP/1.0,
    // Portable SDK for UPnP devices/<version>". Some devices (GUPnP) describe
    // their version-1 services only to clients that name this SDK.
    static const std::string agent = [] {
        struct utsname names;
        std::string text = "Linux/unknown";
        if (uname(&names) == 0)
            text = std::string(names.sysname) + "/" + names.release;
        return text + ", UPnP/1.0, Portable SDK for UPnP devices/" UPNP_VERSION_STRING;
    }();
    return agent.c_str();
}

void XmlAbortDownloads(bool abort)
{
    g_abortDownloads = abort;
}

int XmlDownloadDoc(const char *url, IXML_Document **doc)
{
    // A device that answers slowly, never finishes or trickles its answer
    // holds the calling libupnp thread for at most these times.
    static const long kConnectSeconds = 5;
    static const long kTotalSeconds = 10;
    if (doc == nullptr)
        return UPNP_E_INVALID_PARAM;
    *doc = nullptr;
    if (url == nullptr || strncmp(url, "http://", 7) != 0)
        return UPNP_E_INVALID_URL;

    HttpFetchOptions options;
    options.maxBytes = kXmlMaxDocumentBytes;
    options.connectTimeoutSeconds = kConnectSeconds;
    options.timeoutSeconds = kTotalSeconds;
    options.userAgent = XmlUserAgent();
    options.protocols = "http";
    options.noProxy = true;
    options.abort = &g_abortDownloads;
    std::string body;
    HttpFetchResult result;
    if (HttpFetch(url, options, &body, &result) != 0) {
        switch (result.error) {
        case HTTP_FETCH_NO_HANDLE:
            return UPNP_E_OUTOF_MEMORY;
        case HTTP_FETCH_TOO_LARGE:
            return UPNP_E_OUTOF_BOUNDS;
        case HTTP_FETCH_CONNECT:
            return UPNP_E_SOCKET_CONNECT;
        case HTTP_FETCH_ABORTED:
            return UPNP_E_CANCELED;
        case HTTP_FETCH_TIMEOUT:
            return UPNP_E_TIMEDOUT;
        case HTTP_FETCH_BAD_URL:
            return UPNP_E_INVALID_URL;
        default:
            return UPNP_E_BAD_RESPONSE;
        }
    }
    if (result.status != 200)
        return UPNP_E_BAD_RESPONSE;
    IXML_Document *parsed = nullptr;
    if (XmlParseGuarded(body.c_str(), &parsed) != IXML_SUCCESS || parsed == nullptr) {
        if (parsed != nullptr)
            ixmlDocument_free(parsed);
        return UPNP_E_INVALID_DESC;
    }
    *doc = parsed;
    return UPNP_E_SUCCESS;
}
