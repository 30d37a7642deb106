// XML text helpers, time texts, DIDL-Lite metadata and the guarded parser.
#include <gtest/gtest.h>

#include <cstring>
#include <string>

#include "upnp/xml_util.h"

namespace {

struct Doc {
    IXML_Document *doc = nullptr;
    explicit Doc(const char *text) { EXPECT_EQ(IXML_SUCCESS, ixmlParseBufferEx(text, &doc)); }
    ~Doc()
    {
        if (doc != nullptr)
            ixmlDocument_free(doc);
    }
};

TEST(UpnpXmlText, ElementTextNeedsATextNodeAsFirstChild)
{
    Doc d("<r><a>alpha</a><b><c>inner</c>tail</b><d><![CDATA[raw]]>after</d><e></e><a>second</a></r>");
    ASSERT_NE(nullptr, d.doc);
    EXPECT_EQ("alpha", XmlGetDocElementText(d.doc, "a"));  // first of two
    EXPECT_EQ("", XmlGetDocElementText(d.doc, "b"));       // first child is an element
    EXPECT_EQ("", XmlGetDocElementText(d.doc, "d"));       // first child is a CDATA section
    EXPECT_EQ("", XmlGetDocElementText(d.doc, "e"));       // no child at all
    EXPECT_EQ("", XmlGetDocElementText(d.doc, "missing"));
    EXPECT_EQ("", XmlGetDocElementText(nullptr, "a"));
    EXPECT_EQ("", XmlGetDocElementText(d.doc, nullptr));
    EXPECT_EQ("", XmlGetNodeText(nullptr));

    IXML_Element *b = XmlGetDocElement(d.doc, "b");
    ASSERT_NE(nullptr, b);
    EXPECT_EQ("inner", XmlGetElementChildText(b, "c"));
    EXPECT_EQ("", XmlGetElementChildText(b, "a"));  // only below b
    EXPECT_EQ(nullptr, XmlGetDocElement(d.doc, "missing"));
}

TEST(UpnpXmlText, TagNamesMatchWithTheirPrefix)
{
    Doc d("<r xmlns:u=\"urn:x\"><u:name>prefixed</u:name></r>");
    EXPECT_EQ("", XmlGetDocElementText(d.doc, "name"));
    EXPECT_EQ("prefixed", XmlGetDocElementText(d.doc, "u:name"));
}

TEST(UpnpXmlText, ValAttributeOfFirstElement)
{
    Doc d("<Event><InstanceID val=\"0\"><Volume channel=\"Master\" val=\"42\"/>"
          "<Volume channel=\"LF\" val=\"7\"/><Mute channel=\"Master\"/></InstanceID></Event>");
    EXPECT_EQ("42", XmlGetDocElementVal(d.doc, "Volume"));
    EXPECT_EQ("", XmlGetDocElementVal(d.doc, "Mute"));      // no val attribute
    EXPECT_EQ("", XmlGetDocElementVal(d.doc, "Missing"));   // no element
    EXPECT_EQ("", XmlGetDocElementVal(nullptr, "Volume"));
}

TEST(UpnpXmlText, FindItemByChildTextAndChildWithText)
{
    Doc d("<scpd><actionList>"
          "<action><name>Play</name></action>"
          "<action><name>Seek</name><argumentList><argument><name>Unit</name></argument>"
          "</argumentList></action>"
          "<action><name>Seeking</name></action>"
          "</actionList><list><allowedValue>ABS_TIME</allowedValue>"
          "<allowedValue>REL_TIME</allowedValue></list></scpd>");
    IXML_Element *actions = XmlGetDocElement(d.doc, "actionList");
    ASSERT_NE(nullptr, actions);
    IXML_Element *seek = XmlFindItemByChildText(actions, "action", "name", "Seek");
    ASSERT_NE(nullptr, seek);
    EXPECT_EQ("Seek", XmlGetElementChildText(seek, "name"));
    EXPECT_EQ(nullptr, XmlFindItemByChildText(actions, "action", "name", "Seek "));
    EXPECT_EQ(nullptr, XmlFindItemByChildText(actions, "action", "name", "Stop"));
    EXPECT_EQ(nullptr, XmlFindItemByChildText(nullptr, "action", "name", "Seek"));
    EXPECT_EQ(nullptr, XmlFindItemByChildText(actions, "action", "name", nullptr));

    IXML_Element *list = XmlGetDocElement(d.doc, "list");
    EXPECT_TRUE(XmlHasChildWithText(list, "allowedValue", "REL_TIME"));
    EXPECT_FALSE(XmlHasChildWithText(list, "allowedValue", "REL"));
    EXPECT_FALSE(XmlHasChildWithText(list, "allowedValue", "TRACK_NR"));
    EXPECT_FALSE(XmlHasChildWithText(nullptr, "allowedValue", "REL_TIME"));
}

TEST(UpnpXmlText, EscapeReplacesTheFiveSpecialCharacters)
{
    EXPECT_EQ("Tom &amp; Jerry&apos;s &lt;Live&gt;", XmlEscape("Tom & Jerry's <Live>"));
    EXPECT_EQ("&quot;", XmlEscape("\""));
    EXPECT_EQ("", XmlEscape(""));
    EXPECT_EQ("caf\xc3\xa9 ok", XmlEscape("caf\xc3\xa9 ok"));  // other bytes as they are
    EXPECT_EQ("&amp;amp;", XmlEscape("&amp;"));                // escaped once more
}

TEST(UpnpXmlText, ReplaceAllSearchesOnBehindEachReplacement)
{
    std::string t = "a-b-c";
    StringReplaceAll(t, "-", "+-");
    EXPECT_EQ("a+-b+-c", t);
    t = "aaa";
    StringReplaceAll(t, "a", "");
    EXPECT_EQ("", t);
    t = "unchanged";
    StringReplaceAll(t, "", "x");
    EXPECT_EQ("unchanged", t);
}

TEST(UpnpTimeText, ParsesHoursMinutesSeconds)
{
    EXPECT_EQ(205, TimeStringToSeconds("0:03:25.000"));
    EXPECT_EQ(245, TimeStringToSeconds("0:04:05"));
    EXPECT_EQ(3725, TimeStringToSeconds("01:02:05.5"));
    EXPECT_EQ(9639, TimeStringToSeconds("1:99:99"));  // no range check
    EXPECT_EQ(-3600 + 60 + 1, TimeStringToSeconds("-1:01:01"));
    EXPECT_EQ(-1, TimeStringToSeconds("00:03"));
    EXPECT_EQ(-1, TimeStringToSeconds(""));
    EXPECT_EQ(-1, TimeStringToSeconds(nullptr));
    EXPECT_EQ(-1, TimeStringToSeconds("NOT_IMPLEMENTED"));
}

TEST(UpnpTimeText, WritesHoursUnpaddedAndAFraction)
{
    char buf[32];
    ASSERT_EQ(0, SecondsToTimeString(3725, buf, sizeof(buf)));
    EXPECT_STREQ("1:02:05.000", buf);
    ASSERT_EQ(0, SecondsToTimeString(0, buf, sizeof(buf)));
    EXPECT_STREQ("0:00:00.000", buf);
    ASSERT_EQ(0, SecondsToTimeString(360000, buf, sizeof(buf)));
    EXPECT_STREQ("100:00:00.000", buf);
    EXPECT_EQ(-1, SecondsToTimeString(-1, buf, sizeof(buf)));
    EXPECT_EQ(-1, SecondsToTimeString(5, nullptr, 32));
    EXPECT_EQ(-1, SecondsToTimeString(5, buf, 0));
    char small[5];
    ASSERT_EQ(0, SecondsToTimeString(3725, small, sizeof(small)));  // cut, terminated
    EXPECT_STREQ("1:02", small);
    // Round trip.
    for (int s : {0, 59, 60, 3599, 3600, 86399, 1234567}) {
        ASSERT_EQ(0, SecondsToTimeString(s, buf, sizeof(buf)));
        EXPECT_EQ(s, TimeStringToSeconds(buf)) << buf;
    }
}

TARN_MEDIA_INFO Song(const char *path, const char *title, const char *artist, const char *album,
                     const char *genre, int track, float duration)
{
    TARN_MEDIA_INFO s;
    memset(&s, 0, sizeof(s));
    snprintf(s.path, sizeof(s.path), "%s", path);
    snprintf(s.title, sizeof(s.title), "%s", title);
    snprintf(s.artist, sizeof(s.artist), "%s", artist);
    snprintf(s.album, sizeof(s.album), "%s", album);
    snprintf(s.genre, sizeof(s.genre), "%s", genre);
    s.track = track;
    s.duration = duration;
    return s;
}

TEST(UpnpDidl, ExactElementSequence)
{
    TARN_MEDIA_INFO s = Song("/shares/Music/a.mp3", "Tom & Jerry's <Live>", "The \"Band\"",
                             "Album", "Rock", 7, 245.9f);
    std::string out;
    ASSERT_EQ(0, BuildDidlMetadata(&s, "http://10.0.0.1/audio/x.cgi/ab.mp3?a=1&b=2", out));
    EXPECT_EQ("<DIDL-Lite xmlns=\"urn:schemas-upnp-org:metadata-1-0/DIDL-Lite/\" "
              "xmlns:dc=\"http://purl.org/dc/elements/1.1/\" "
              "xmlns:upnp=\"urn:schemas-upnp-org:metadata-1-0/upnp/\"><item>"
              "<dc:title>Tom &amp; Jerry&apos;s &lt;Live&gt;</dc:title>"
              "<dc:creator>The &quot;Band&quot;</dc:creator>"
              "<res duration=\"0:04:05.000\" protocolInfo=\"http-get:*:audio/mpeg:*\">"
              "http://10.0.0.1/audio/x.cgi/ab.mp3?a=1&b=2</res>"
              "<upnp:album>Album</upnp:album>"
              "<upnp:artist>The &quot;Band&quot;</upnp:artist>"
              "<upnp:originalTrackNumber>7</upnp:originalTrackNumber>"
              "<upnp:genre>Rock</upnp:genre>"
              "<upnp:class>object.item.audioItem.musicTrack</upnp:class>"
              "</item></DIDL-Lite>",
              out);
    // Apart from the unescaped URL it is well-formed XML.
    TARN_MEDIA_INFO plain = s;
    std::string wellFormed;
    ASSERT_EQ(0, BuildDidlMetadata(&plain, "http://h/x.mp3", wellFormed));
    IXML_Document *doc = nullptr;
    ASSERT_EQ(IXML_SUCCESS, ixmlParseBufferEx(wellFormed.c_str(), &doc));
    EXPECT_EQ("Tom & Jerry's <Live>", XmlGetDocElementText(doc, "dc:title"));
    ixmlDocument_free(doc);
}

TEST(UpnpDidl, EmptyFieldsAndUnknownExtension)
{
    TARN_MEDIA_INFO s = Song("/shares/Music/noext", "", "", "", "", 0, 0.0f);
    std::string out;
    ASSERT_EQ(0, BuildDidlMetadata(&s, "http://h/x", out));
    EXPECT_NE(std::string::npos, out.find("<dc:title></dc:title><dc:creator></dc:creator>"));
    EXPECT_NE(std::string::npos,
              out.find("<res duration=\"0:00:00.000\" protocolInfo=\"http-get:*:text/plain:*\">"));
    EXPECT_NE(std::string::npos, out.find("<upnp:genre></upnp:genre>"));

    TARN_MEDIA_INFO odd = Song("/shares/Music/a.xyz", "t", "a", "b", "g", 1, 10.0f);
    ASSERT_EQ(0, BuildDidlMetadata(&odd, "http://h/x", out));
    EXPECT_NE(std::string::npos, out.find("http-get:*:text/plain:*"));

    TARN_MEDIA_INFO flac = Song("/shares/Music/A.FLAC", "t", "a", "b", "g", 1, 10.0f);
    ASSERT_EQ(0, BuildDidlMetadata(&flac, "http://h/x", out));
    EXPECT_EQ(std::string::npos, out.find("text/plain"));
}

TEST(UpnpDidl, FailsWithoutSongOrWithNegativeDuration)
{
    std::string out = "kept";
    EXPECT_EQ(-1, BuildDidlMetadata(nullptr, "http://h/x", out));
    TARN_MEDIA_INFO s = Song("/a.mp3", "t", "a", "b", "g", 1, -3.0f);
    EXPECT_EQ(-1, BuildDidlMetadata(&s, "http://h/x", out));
    EXPECT_EQ("kept", out);
}

TEST(UpnpDidl, LongElementIsCutAt4095Bytes)
{
    TARN_MEDIA_INFO s = Song("/a.mp3", "t", "a", "b", "g", 1, 1.0f);
    std::string url(5000, 'u');
    std::string out;
    ASSERT_EQ(0, BuildDidlMetadata(&s, url.c_str(), out));
    size_t res = out.find("<res ");
    size_t album = out.find("<upnp:album>");
    ASSERT_NE(std::string::npos, res);
    ASSERT_NE(std::string::npos, album);
    EXPECT_EQ(4095u, album - res);  // no closing </res>: the piece was cut
    EXPECT_EQ(std::string::npos, out.find("</res>"));

    // Fields filled to their last byte without a terminator stay inside the record.
    TARN_MEDIA_INFO full = Song("/a.mp3", "", "", "", "", 1, 1.0f);
    memset(full.title, 'T', sizeof(full.title));
    memset(full.album, 'A', sizeof(full.album));
    ASSERT_EQ(0, BuildDidlMetadata(&full, "http://h/x", out));
    EXPECT_NE(std::string::npos, out.find("<dc:title>" + std::string(sizeof(full.title), 'T') +
                                          "</dc:title>"));
}

TEST(UpnpXmlGuard, RefusesDeepNestingAndHugeTexts)
{
    std::string ok = "<a><b><c x=\"1\"/><!-- c --><?pi x?></b></a>";
    EXPECT_EQ(0, XmlCheckLimits(ok.c_str(), ok.size()));

    auto nested = [](int depth) {
        std::string t;
        for (int i = 0; i < depth; ++i)
            t += "<n>";
        for (int i = 0; i < depth; ++i)
            t += "</n>";
        return t;
    };
    std::string shallow = nested(kXmlMaxDepth);
    std::string deep = nested(kXmlMaxDepth + 1);
    EXPECT_EQ(0, XmlCheckLimits(shallow.c_str(), shallow.size()));
    EXPECT_EQ(-1, XmlCheckLimits(deep.c_str(), deep.size()));
    // Unclosed nesting counts too.
    std::string unclosed(200000, 'x');
    for (size_t i = 0; i < 100000; i += 3)
        unclosed.replace(i, 3, "<a>");
    EXPECT_EQ(-1, XmlCheckLimits(unclosed.c_str(), unclosed.size()));
    // Many flat siblings.
    std::string flat;
    for (int i = 0; i <= kXmlMaxNodes; ++i)
        flat += "<i/>";
    EXPECT_EQ(-1, XmlCheckLimits(flat.c_str(), flat.size()));
    // Size.
    std::string big(kXmlMaxDocumentBytes + 1, ' ');
    EXPECT_EQ(-1, XmlCheckLimits(big.c_str(), big.size()));

    IXML_Document *doc = nullptr;
    EXPECT_NE(IXML_SUCCESS, XmlParseGuarded(deep.c_str(), &doc));
    EXPECT_EQ(nullptr, doc);
    ASSERT_EQ(IXML_SUCCESS, XmlParseGuarded(shallow.c_str(), &doc));
    ASSERT_NE(nullptr, doc);
    ixmlDocument_free(doc);
    doc = nullptr;
    EXPECT_NE(IXML_SUCCESS, XmlParseGuarded("<a><b></a>", &doc));
    EXPECT_EQ(nullptr, doc);
    EXPECT_NE(IXML_SUCCESS, XmlParseGuarded(nullptr, &doc));
}

}  // namespace
