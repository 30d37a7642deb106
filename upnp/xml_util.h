// Text helpers over ixml documents, XML escaping, UPnP time texts and the
// DIDL-Lite metadata of one queue entry.
#ifndef TARN_XML_UTIL_H
#define TARN_XML_UTIL_H

#include <cstddef>
#include <string>

#include "upnp/upnp_sdk.h"

#include "platform/tarn_media_info.h"

// Text of an element: the value of its first child when that child is a text
// node, else "". "" for a missing node.
std::string XmlGetNodeText(IXML_Node *node);

// Text of the first element of that tag name anywhere in the document.
std::string XmlGetDocElementText(IXML_Document *doc, const char *tag);

// Text of the first descendant of the element with that tag name.
std::string XmlGetElementChildText(IXML_Element *element, const char *tag);

// First element of that tag name in the document, or nullptr.
IXML_Element *XmlGetDocElement(IXML_Document *doc, const char *tag);

// "val" attribute of the first element of that tag name, "" when absent.
std::string XmlGetDocElementVal(IXML_Document *doc, const char *tag);

// First descendant of parent named itemTag whose childTag text equals value.
IXML_Element *XmlFindItemByChildText(IXML_Element *parent, const char *itemTag,
                                     const char *childTag, const char *value);

// True when a descendant named tag has exactly the text value.
bool XmlHasChildWithText(IXML_Element *element, const char *tag, const char *value);

// Text with " < > ' & replaced by their entities.
std::string XmlEscape(const std::string &text);

// Replaces every occurrence of from with to, searching on behind each
// replacement (so a to that contains from cannot loop).
void StringReplaceAll(std::string &text, const std::string &from, const std::string &to);

// "H:MM:SS[.fff]" -> seconds; -1 when it does not parse.
int TimeStringToSeconds(const char *text);

// seconds -> "H:MM:SS.000"; 0, or -1 for a bad buffer or negative seconds.
int SecondsToTimeString(int seconds, char *buffer, int size);

// DIDL-Lite metadata of one song for SetAVTransportURI.
int BuildDidlMetadata(const TARN_MEDIA_INFO *song, const char *url, std::string &out);

// ---------------------------------------------------------------------------
// Guarded parsing and downloading. Device descriptions, service descriptions
// and LastChange texts come from other machines on the network; ixml parses
// and frees recursively, so a document that is too big or too deeply nested
// is refused before ixml sees it.
enum {
    kXmlMaxDocumentBytes = 256 * 1024,  // largest document accepted
    kXmlMaxDepth = 64,                  // deepest element nesting accepted
    kXmlMaxNodes = 8192,                // most markup items accepted
};

// 0 when the text may be handed to ixml, -1 when it is too large, nests
// too deeply or holds too many elements.
int XmlCheckLimits(const char *text, size_t length);

// XmlCheckLimits, then ixmlParseBufferEx. Returns the ixml error code
// (IXML_SUCCESS) or IXML_INSUFFICIENT_MEMORY for a refused text.
int XmlParseGuarded(const char *text, IXML_Document **doc);

// Downloads (libcurl, plain HTTP only, no proxy, no redirects) and parses an
// XML document, bounded in size and time. libupnp's own downloader has no
// bounds and parses without the limits above; its HTTP GET calls send a
// broken Host header in this libupnp version. Returns UPNP_E_SUCCESS with *doc set, or a libupnp error
// code (UPNP_E_INVALID_DESC for a document that does not parse or is refused).
int XmlDownloadDoc(const char *url, IXML_Document **doc);

// The User-Agent of description and SCPD downloads: the one libupnp sends.
const char *XmlUserAgent();

// With true, running and later downloads give up at once (UPNP_E_CANCELED):
// set while the control point shuts down so that libupnp's threads end
// promptly. false allows downloads again.
void XmlAbortDownloads(bool abort);

#endif
