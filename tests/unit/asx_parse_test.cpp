// The ASX station file reader: line-start tags in any case, the closing
// title tag in upper case only, buffers carried from entry to entry.
#include <gtest/gtest.h>

#include <string>

#include <json/json.h>

#include "source/asxparse.h"
#include "tests/harness/harness.h"

namespace {

class AsxParseTest : public ::testing::Test {
protected:
    tarntest::Harness h;

    // Parses text written to a file of the root; returns AsxParse's result.
    int Parse(const std::string &text, Json::Value &list)
    {
        EXPECT_EQ(0, h.WriteFile("/tmp/test.asx", text));
        return AsxParse(h.Path("/tmp/test.asx").c_str(), list);
    }

    static std::string Station(const Json::Value &list, int i, const char *key)
    {
        return list["stations"][i][key].asString();
    }
};

TEST_F(AsxParseTest, TagsAtLineStartMatchInAnyCase)
{
    Json::Value list;
    ASSERT_EQ(0, Parse("<ASX version=\"3.0\">\n"
                       "ENTRY>\n"  // not a tag
                       "<ENTRY>\n"
                       "<Title>Mixed Case Radio</TITLE>\n"
                       "<REF HREF=\"http://example.org/mixed\" />\n"
                       "</entry>\n"
                       "</ASX>\n",
                       list));
    ASSERT_EQ(1u, list["stations"].size());
    EXPECT_EQ(1u, list["total"].asUInt());
    EXPECT_TRUE(list["total"].isUInt());
    EXPECT_EQ("Mixed Case Radio", Station(list, 0, "name"));
    EXPECT_EQ("http://example.org/mixed", Station(list, 0, "url"));
    EXPECT_EQ("", Station(list, 0, "desc"));
    // Exactly the three members, in this order, no bit rate.
    std::vector<std::string> members = list["stations"][0].getMemberNames();
    EXPECT_EQ(3u, members.size());
    EXPECT_FALSE(list["stations"][0].isMember("bitrate"));
}

TEST_F(AsxParseTest, LowerCaseClosingTitleTagLeavesNoTitle)
{
    Json::Value list;
    ASSERT_EQ(0, Parse("<entry>\n<title>quiet radio</title>\n<ref href=\"http://q\"/>\n</entry>\n",
                       list));
    EXPECT_EQ(0u, list["stations"].size());
    EXPECT_EQ(0u, list["total"].asUInt());
}

TEST_F(AsxParseTest, OneLineEntryYieldsNothing)
{
    Json::Value list;
    ASSERT_EQ(0, Parse("<Entry><TITLE>One Line</TITLE><Ref href=\"http://one\"/></Entry>\n", list));
    EXPECT_EQ(0u, list["stations"].size());
}

TEST_F(AsxParseTest, MissingTagsTakeValuesOfEarlierEntries)
{
    Json::Value list;
    ASSERT_EQ(0, Parse("<Entry>\n<TITLE>First</TITLE>\n<Ref href=\"http://first\"/>\n</Entry>\n"
                       "<Entry>\n<Ref href=\"http://second\"/>\n</Entry>\n"
                       "<Entry>\n<TITLE>Third</TITLE>\n</Entry>\n",
                       list));
    ASSERT_EQ(3u, list["stations"].size());
    EXPECT_EQ("First", Station(list, 1, "name"));
    EXPECT_EQ("http://second", Station(list, 1, "url"));
    EXPECT_EQ("Third", Station(list, 2, "name"));
    EXPECT_EQ("http://second", Station(list, 2, "url"));
}

TEST_F(AsxParseTest, BadTagLinesClearTheirBufferAndDropTheEntry)
{
    Json::Value list;
    // The second entry's title line has no closing tag and its reference
    // uses single quotes: both buffers are cleared, the entry is dropped,
    // and the third entry, lacking both tags, is dropped too.
    ASSERT_EQ(0, Parse("<Entry>\n<TITLE>Good</TITLE>\n<Ref href=\"http://good\"/>\n</Entry>\n"
                       "<Entry>\n<TITLE>Unclosed\n<Ref href='http://single'/>\n</Entry>\n"
                       "<Entry>\n</Entry>\n"
                       "<Entry>\n<TITLE>Unterminated</TITLE>\n<Ref href=\"http://open\n</Entry>\n",
                       list));
    ASSERT_EQ(1u, list["stations"].size());
    EXPECT_EQ("Good", Station(list, 0, "name"));
}

TEST_F(AsxParseTest, BlanksAroundTagsAndEntityTextKept)
{
    Json::Value list;
    ASSERT_EQ(0, Parse("\t  <Entry>  \r\n"
                       " \t<TITLE> Rock &amp; Roll </TITLE> trailing\r\n"
                       "\t\t<Ref href=\"http://a/b?c=d\" extra=\"x\"/>\r\n"
                       "   <Entry>\n"  // a second opening tag continues the entry
                       "\t</Entry>\n",
                       list));
    ASSERT_EQ(1u, list["stations"].size());
    EXPECT_EQ(" Rock &amp; Roll ", Station(list, 0, "name"));
    EXPECT_EQ("http://a/b?c=d", Station(list, 0, "url"));
}

TEST_F(AsxParseTest, EndOfFileEndsAnOpenEntry)
{
    Json::Value list;
    ASSERT_EQ(0, Parse("<Entry>\n<TITLE>Last</TITLE>\n<Ref href=\"http://last\"/>", list));
    ASSERT_EQ(1u, list["stations"].size());
    EXPECT_EQ("http://last", Station(list, 0, "url"));
}

TEST_F(AsxParseTest, LongTitleIsCutAndLongLinesSplit)
{
    Json::Value list;
    std::string longTitle(300, 'T');
    // A title line longer than the line buffer is read in two pieces: the
    // first lacks the closing tag (no title), the second is no tag at all.
    std::string hugeTitle(5000, 'H');
    ASSERT_EQ(0, Parse("<Entry>\n<TITLE>" + longTitle + "</TITLE>\n<Ref href=\"http://long\"/>\n"
                       "</Entry>\n"
                       "<Entry>\n<TITLE>" + hugeTitle + "</TITLE>\n<Ref href=\"http://huge\"/>\n"
                       "</Entry>\n",
                       list));
    ASSERT_EQ(1u, list["stations"].size());
    EXPECT_EQ(std::string(254, 'T'), Station(list, 0, "name"));

    // A reference line split the same way: its first piece has no closing
    // quote (URL cleared), and the piece holding the end is not a tag.
    std::string longUrl = "http://x/" + std::string(4200, 'u');
    ASSERT_EQ(0, Parse("<Entry>\n<TITLE>Station</TITLE>\n<Ref href=\"" + longUrl + "\"/>\n"
                       "</Entry>\n",
                       list));
    EXPECT_EQ(0u, list["stations"].size());
}

TEST_F(AsxParseTest, EmptyMissingAndUnreadableFiles)
{
    Json::Value list;
    ASSERT_EQ(0, Parse("", list));
    EXPECT_TRUE(list["stations"].isArray());
    EXPECT_EQ(0u, list["stations"].size());
    EXPECT_EQ(0u, list["total"].asUInt());

    Json::Value untouched;
    untouched["keep"] = 1;
    EXPECT_EQ(-1, AsxParse(h.Path("/tmp/none.asx").c_str(), untouched));
    EXPECT_EQ(-1, AsxParse(h.Path("/tmp").c_str(), untouched));  // read error
    EXPECT_EQ(1, untouched["keep"].asInt());
    EXPECT_FALSE(untouched.isMember("stations"));

    h.ClearLog();
    EXPECT_EQ(-1, AsxParse(nullptr, untouched));
    EXPECT_EQ(-1, AsxParse("", untouched));
    EXPECT_EQ(2, h.CountLog("asxparse:"));
    EXPECT_EQ(2, h.CountLog("Bad parameters."));
}

TEST_F(AsxParseTest, ImportDefaultPicksTheFileOfTheListType)
{
    ASSERT_EQ(0, h.WriteFile(TARN_ASX_MANUAL,
                             "<Entry>\n<TITLE>Manual</TITLE>\n<Ref href=\"http://m\"/>\n</Entry>\n"));
    ASSERT_EQ(0, h.WriteFile(TARN_ASX_DEFAULT,
                             "<Entry>\n<TITLE>Default</TITLE>\n<Ref href=\"http://d\"/>\n</Entry>\n"));
    Json::Value list;
    ASSERT_EQ(0, AsxImportDefault(1, list));
    EXPECT_EQ("Manual", Station(list, 0, "name"));
    ASSERT_EQ(0, AsxImportDefault(2, list));
    EXPECT_EQ("Default", Station(list, 0, "name"));
    EXPECT_EQ(-1, AsxImportDefault(3, list));
    EXPECT_EQ(-1, AsxImportDefault(0, list));
}

TEST_F(AsxParseTest, ShippedSeedFilesParse)
{
    for (const char *file : {"data/radio/default_radio_station.asx",
                             "data/radio/manual_radio_station.asx"}) {
        Json::Value list;
        ASSERT_EQ(0, AsxParse(tarntest::SourcePath(file).c_str(), list)) << file;
        EXPECT_GE(list["total"].asUInt(), 2u) << file;
        for (const Json::Value &s : list["stations"]) {
            EXPECT_FALSE(s["name"].asString().empty());
            EXPECT_EQ(0u, s["url"].asString().rfind("http", 0)) << s["url"].asString();
        }
    }
}

}  // namespace
