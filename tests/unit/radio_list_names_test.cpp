// A radio list file whose member names hold NUL bytes (a damaged file):
// edits saved over it must read back as they were made. Found by the
// radio_list fuzz target: "stations\0..." was written as a second
// "stations" member and shadowed the stations just added.
#include <gtest/gtest.h>

#include <fstream>
#include <sstream>
#include <string>

#include <json/json.h>

#include "source/radiolist.h"
#include "tests/harness/harness.h"

namespace {

std::string Read(const std::string &path)
{
    std::ifstream in(path, std::ios::binary);
    std::stringstream ss;
    ss << in.rdbuf();
    return ss.str();
}

TEST(RadioListNames, NulInMemberNamesDoesNotShadowTheStations)
{
    tarntest::Harness h;  // private root for TarnPath
    std::string damaged = std::string("{\"stations") + std::string(3, '\0') +
                          "\":\"128\",\"total\":0,\"stations\":[{\"name\":\"A\",\"url\":\"http://a/\","
                          "\"x" + std::string(1, '\0') + "y\":1}]}";
    ASSERT_EQ(0, h.WriteFile(TARN_RADIO_USERDEF, damaged));

    Json::Value add(Json::arrayValue);
    Json::Value s(Json::objectValue);
    s["name"] = "Added";
    s["url"] = "http://added/";
    add.append(s);
    ASSERT_EQ(0, RadioListAdd(RADIO_LIST_USERDEF, add));

    std::string text = Read(h.Path(TARN_RADIO_USERDEF));
    Json::Value back;
    ASSERT_TRUE(Json::Reader().parse(text, back)) << text;
    ASSERT_TRUE(back["stations"].isArray()) << text;
    ASSERT_EQ(2u, back["stations"].size()) << text;
    EXPECT_EQ("A", back["stations"][0]["name"].asString());
    EXPECT_EQ("Added", back["stations"][1]["name"].asString());
    EXPECT_EQ(2, back["total"].asInt());
    EXPECT_EQ(std::string::npos, text.find('\0'));

    // And through the reader the daemon uses.
    Json::Value list;
    ASSERT_EQ(0, RadioListGet(RADIO_LIST_USERDEF, list));
    EXPECT_EQ(2u, list["stations"].size());
}

}  // namespace
