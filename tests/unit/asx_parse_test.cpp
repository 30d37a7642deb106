// The ASX station file reader: line-start tags in any case, the closing
// title tag in upper case only, buffers carried from entry to entry.
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include <json/json.h>

#include "source/asxparse.h"
#include "tests/harness/harness.h"

namespace {

// "name=url" of each station, or "error".
std::string Parse(tarntest::Harness &h, const std::string &text)
{
    EXPECT_EQ(0, h.WriteFile("/tmp/test.asx", text));
    Json::Value list;
    if (AsxParse(h.Path("/tmp/test.asx").c_str(), list) != 0)
        return "error";
    std::string s;
    EXPECT_EQ(list["stations"].size(), list["total"].asUInt());
    for (const Json::Value &st : list["stations"]) {
        EXPECT_EQ((std::vector<std::string>{"desc", "name", "url"}), st.getMemberNames());
        s += st["name"].asString() + "=" + st["url"].asString() + ";";
    }
    return s;
}

std::string Entry(const std::string &title, const std::string &url)
{
    return "<Entry>\n<TITLE>" + title + "</TITLE>\n<Ref href=\"" + url + "\"/>\n</Entry>\n";
}

TEST(AsxParse, TagRulesAndCarriedBuffers)
{
    tarntest::Harness h;
    struct Case { const char *what; std::string text, want; } cases[] = {
        {"tags at line start in any case",
         "<ASX version=\"3.0\">\nENTRY>\n<ENTRY>\n<Title>Mixed Case Radio</TITLE>\n"
         "<REF HREF=\"http://example.org/mixed\" />\n</entry>\n</ASX>\n",
         "Mixed Case Radio=http://example.org/mixed;"},
        {"lower-case closing title tag: no title",
         "<entry>\n<title>quiet radio</title>\n<ref href=\"http://q\"/>\n</entry>\n", ""},
        {"one-line entry", "<Entry><TITLE>One</TITLE><Ref href=\"http://one\"/></Entry>\n", ""},
        {"missing tags take earlier entries' values",
         Entry("First", "http://first") + "<Entry>\n<Ref href=\"http://second\"/>\n</Entry>\n"
             "<Entry>\n<TITLE>Third</TITLE>\n</Entry>\n",
         "First=http://first;First=http://second;Third=http://second;"},
        {"bad tag lines clear their buffer and drop the entry",
         Entry("Good", "http://good") + "<Entry>\n<TITLE>Unclosed\n<Ref href='http://single'/>\n</Entry>\n"
             "<Entry>\n</Entry>\n<Entry>\n<TITLE>Open</TITLE>\n<Ref href=\"http://open\n</Entry>\n",
         "Good=http://good;"},
        {"blanks around tags, entity text kept",
         "\t  <Entry>  \r\n \t<TITLE> Rock &amp; Roll </TITLE> trailing\r\n"
         "\t\t<Ref href=\"http://a/b?c=d\" extra=\"x\"/>\r\n   <Entry>\n\t</Entry>\n",
         " Rock &amp; Roll =http://a/b?c=d;"},
        {"end of file ends an open entry", "<Entry>\n<TITLE>Last</TITLE>\n<Ref href=\"http://last\"/>",
         "Last=http://last;"},
        {"long title cut; a line longer than the buffer is split and lost",
         Entry(std::string(300, 'T'), "http://long") + Entry(std::string(5000, 'H'), "http://huge"),
         std::string(254, 'T') + "=http://long;"},
        {"split reference line", Entry("Station", "http://x/" + std::string(4200, 'u')), ""},
        {"empty file", "", ""},
    };
    for (const Case &c : cases)
        EXPECT_EQ(c.want, Parse(h, c.text)) << c.what;

    Json::Value untouched;
    untouched["keep"] = 1;
    EXPECT_EQ(-1, AsxParse(h.Path("/tmp/none.asx").c_str(), untouched));
    EXPECT_EQ(-1, AsxParse(h.Path("/tmp").c_str(), untouched));  // read error
    EXPECT_EQ(-1, AsxParse(nullptr, untouched));
    EXPECT_EQ((std::vector<std::string>{"keep"}), untouched.getMemberNames());
}

// (Which seed file each list type falls back to: radio_list_test.)
TEST(AsxParse, ShippedSeedFilesParse)
{
    for (const char *file : {"data/radio/default_radio_station.asx", "data/radio/manual_radio_station.asx"}) {
        Json::Value list;
        ASSERT_EQ(0, AsxParse(tarntest::SourcePath(file).c_str(), list)) << file;
        EXPECT_GE(list["total"].asUInt(), 2u) << file;
        for (const Json::Value &s : list["stations"])
            EXPECT_EQ(0u, s["url"].asString().rfind("http", 0)) << file;
    }
}

}  // namespace
