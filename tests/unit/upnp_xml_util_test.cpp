// XML text helpers, time texts, DIDL-Lite metadata and the guarded parser.
#include <gtest/gtest.h>

#include <cstring>
#include <string>

#include "upnp/xml_util.h"

namespace {

struct Doc {
    IXML_Document *doc = nullptr;
    explicit Doc(const std::string &text) { EXPECT_EQ(IXML_SUCCESS, ixmlParseBufferEx(text.c_str(), &doc)); }
    ~Doc() { ixmlDocument_free(doc); }
};

TEST(UpnpXmlText, ElementTextValChildLookupsAndReplace)
{
    Doc d("<r xmlns:u=\"urn:x\"><a>alpha</a><b><c>inner</c>tail</b><d><![CDATA[raw]]></d><e></e>"
          "<a>second</a><u:title>prefixed</u:title><Volume channel=\"Master\" val=\"42\"/><Volume val=\"7\"/>"
          "<Mute/><list><item><name>Play</name></item><item><name>Seek</name></item></list></r>");
    // Text only when the first child is a text node; tag names match with their prefix.
    for (auto k : {std::make_pair("a", "alpha"), {"b", ""}, {"d", ""}, {"e", ""}, {"missing", ""},
                   {"title", ""}, {"u:title", "prefixed"}})
        EXPECT_EQ(k.second, XmlGetDocElementText(d.doc, k.first)) << k.first;
    EXPECT_EQ("", XmlGetDocElementText(nullptr, "a"));
    EXPECT_EQ("inner", XmlGetElementChildText(XmlGetDocElement(d.doc, "b"), "c"));
    EXPECT_EQ("", XmlGetElementChildText(XmlGetDocElement(d.doc, "b"), "a"));  // only below b
    EXPECT_EQ("42", XmlGetDocElementVal(d.doc, "Volume"));                     // the first one
    EXPECT_EQ("", XmlGetDocElementVal(d.doc, "Mute"));
    EXPECT_EQ("", XmlGetDocElementVal(d.doc, "Missing"));

    // Exact text only (the capability probe's table covers the rest).
    IXML_Element *list = XmlGetDocElement(d.doc, "list");
    EXPECT_EQ("Seek", XmlGetElementChildText(XmlFindItemByChildText(list, "item", "name", "Seek"), "name"));
    EXPECT_EQ(nullptr, XmlFindItemByChildText(list, "item", "name", "Seek "));
    EXPECT_FALSE(XmlHasChildWithText(list, "name", "Se"));
    std::string t = "a-b";
    StringReplaceAll(t, "-", "+-");  // searches on behind each replacement
    EXPECT_EQ("a+-b", t);
}

TEST(UpnpTimeText, ParseWriteAndRoundTrip)
{
    for (auto k : {std::make_pair("0:03:25.000", 205), {"01:02:05.5", 3725}, {"1:99:99", 9639},
                   {"-1:01:01", -3539}, {"00:03", -1}, {"", -1}, {"NOT_IMPLEMENTED", -1}})
        EXPECT_EQ(k.second, TimeStringToSeconds(k.first)) << k.first;
    EXPECT_EQ(-1, TimeStringToSeconds(nullptr));
    char buf[32], small[5];
    for (auto k : {std::make_pair(3725, "1:02:05.000"), {0, "0:00:00.000"}, {360000, "100:00:00.000"}}) {
        ASSERT_EQ(0, SecondsToTimeString(k.first, buf, sizeof(buf)));
        EXPECT_STREQ(k.second, buf);
        EXPECT_EQ(k.first, TimeStringToSeconds(buf));
    }
    EXPECT_EQ(-1, SecondsToTimeString(-1, buf, sizeof(buf)));
    EXPECT_EQ(-1, SecondsToTimeString(5, nullptr, 32));
    ASSERT_EQ(0, SecondsToTimeString(3725, small, sizeof(small)));  // cut, terminated
    EXPECT_STREQ("1:02", small);
}

TARN_MEDIA_INFO Song(const char *path, const char *title, const char *artist, float duration)
{
    TARN_MEDIA_INFO s;
    memset(&s, 0, sizeof(s));
    snprintf(s.path, sizeof(s.path), "%s", path);
    snprintf(s.title, sizeof(s.title), "%s", title);
    snprintf(s.artist, sizeof(s.artist), "%s", artist);
    snprintf(s.album, sizeof(s.album), "Album");
    snprintf(s.genre, sizeof(s.genre), "Rock");
    s.track = 7;
    s.duration = duration;
    return s;
}

TEST(UpnpDidl, ExactElementSequenceAndMimeTypes)
{
    TARN_MEDIA_INFO s = Song("/shares/Music/a.mp3", "Tom & Jerry's <Live>", "The \"Band\"", 245.9f);
    std::string out;
    ASSERT_EQ(0, BuildDidlMetadata(&s, "http://10.0.0.1/audio/x.cgi/ab.mp3?a=1&b=2", out));
    EXPECT_EQ("<DIDL-Lite xmlns=\"urn:schemas-upnp-org:metadata-1-0/DIDL-Lite/\" "
              "xmlns:dc=\"http://purl.org/dc/elements/1.1/\" "
              "xmlns:upnp=\"urn:schemas-upnp-org:metadata-1-0/upnp/\"><item>"
              "<dc:title>Tom &amp; Jerry&apos;s &lt;Live&gt;</dc:title>"
              "<dc:creator>The &quot;Band&quot;</dc:creator>"
              "<res duration=\"0:04:05.000\" protocolInfo=\"http-get:*:audio/mpeg:*\">"
              "http://10.0.0.1/audio/x.cgi/ab.mp3?a=1&b=2</res>"
              "<upnp:album>Album</upnp:album><upnp:artist>The &quot;Band&quot;</upnp:artist>"
              "<upnp:originalTrackNumber>7</upnp:originalTrackNumber><upnp:genre>Rock</upnp:genre>"
              "<upnp:class>object.item.audioItem.musicTrack</upnp:class></item></DIDL-Lite>",
              out);
    for (auto k : {std::make_pair("/m/noext", true), {"/m/a.xyz", true}, {"/m/A.FLAC", false}}) {
        TARN_MEDIA_INFO t = Song(k.first, "", "", 0.0f);
        ASSERT_EQ(0, BuildDidlMetadata(&t, "http://h/x", out));
        EXPECT_EQ(k.second, out.find("<res duration=\"0:00:00.000\" protocolInfo=\"http-get:*:text/plain:*\">") !=
                                std::string::npos) << k.first;
    }
    // Failures leave the output as it was.
    out = "kept";
    TARN_MEDIA_INFO negative = Song("/a.mp3", "t", "a", -3.0f);
    EXPECT_EQ(-1, BuildDidlMetadata(nullptr, "http://h/x", out));
    EXPECT_EQ(-1, BuildDidlMetadata(&negative, "http://h/x", out));
    EXPECT_EQ("kept", out);
}

TEST(UpnpDidl, LongElementsAreCutAndUnterminatedFieldsStayInside)
{
    TARN_MEDIA_INFO s = Song("/a.mp3", "t", "a", 1.0f);
    std::string out;
    ASSERT_EQ(0, BuildDidlMetadata(&s, std::string(5000, 'u').c_str(), out));
    EXPECT_EQ(4095u, out.find("<upnp:album>") - out.find("<res "));
    EXPECT_EQ(std::string::npos, out.find("</res>"));
    memset(s.title, 'T', sizeof(s.title));
    memset(s.album, 'A', sizeof(s.album));
    ASSERT_EQ(0, BuildDidlMetadata(&s, "http://h/x", out));
    EXPECT_NE(std::string::npos, out.find("<dc:title>" + std::string(sizeof(s.title), 'T') + "</dc:title>"));
}

TEST(UpnpXmlGuard, RefusesDeepNestingManyNodesAndHugeTexts)
{
    auto nested = [](int depth) {
        std::string open, close;
        for (int i = 0; i < depth; ++i)
            open += "<n>", close += "</n>";
        return open + close;
    };
    std::string shallow = nested(kXmlMaxDepth), deep = nested(kXmlMaxDepth + 1), flat, unclosed;
    for (int i = 0; i <= kXmlMaxNodes; ++i)
        flat += "<i/>";
    for (int i = 0; i < 40000; ++i)
        unclosed += "<a>";
    std::string big(kXmlMaxDocumentBytes + 1, ' ');
    EXPECT_EQ(0, XmlCheckLimits(shallow.c_str(), shallow.size()));
    for (const std::string *bad : {&deep, &flat, &unclosed, &big})
        EXPECT_EQ(-1, XmlCheckLimits(bad->c_str(), bad->size())) << bad->substr(0, 20);
    IXML_Document *doc = nullptr;
    for (const char *text : {deep.c_str(), "<a><b></a>", static_cast<const char *>(nullptr)}) {
        EXPECT_NE(IXML_SUCCESS, XmlParseGuarded(text, &doc));
        EXPECT_EQ(nullptr, doc);
    }
    ASSERT_EQ(IXML_SUCCESS, XmlParseGuarded(shallow.c_str(), &doc));
    ixmlDocument_free(doc);
}

}  // namespace
