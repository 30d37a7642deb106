// Radio station lists: the seed-file fallback, the edits with their quirks,
// and damaged list files. (The one-day staleness rule: radio_fetch_test.)
#include <gtest/gtest.h>

#include <string>
#include <unistd.h>

#include <json/json.h>

#include "source/asxparse.h"
#include "source/radiolist.h"
#include "tests/harness/harness.h"

namespace {

const char kFav[] = "/usr/tarn/etc/audio/radio/favorite.json";
const char kUser[] = "/usr/tarn/etc/audio/radio/userdef.json";

Json::Value Station(const std::string &name, const char *bitrate = nullptr)
{
    Json::Value s(Json::objectValue);
    s["name"] = name;
    s["url"] = "http://s/" + name;
    s["desc"] = name + " desc";
    if (bitrate)
        s["bitrate"] = bitrate;
    return s;
}

Json::Value MakeList(int n)
{
    Json::Value list(Json::objectValue);
    list["stations"] = Json::Value(Json::arrayValue);
    for (int i = 0; i < n; i++)
        list["stations"].append(Station("S" + std::to_string(i)));
    list["total"] = n;
    return list;
}

class RadioListTest : public ::testing::Test {
protected:
    tarntest::Harness h;

    void Save(const char *fixedPath, const Json::Value &list)
    {
        ASSERT_EQ(0, RadioListSave(h.Path(fixedPath).c_str(), list));
    }
    Json::Value Saved(const char *fixedPath)
    {
        Json::Value v;
        EXPECT_TRUE(Json::Reader().parse(h.ReadFile(fixedPath), v)) << h.ReadFile(fixedPath);
        return v;
    }
    // "name,name,...;total"
    static std::string Names(const Json::Value &list)
    {
        std::string s;
        for (const Json::Value &st : list["stations"])
            s += st["name"].asString() + ",";
        return s + ";" + std::to_string(list["total"].asInt());
    }
};

TEST_F(RadioListTest, ReadFallsBackToSeedFileThenToEmptyList)
{
    Json::Value list;
    ASSERT_EQ(0, RadioListGet(2, list));  // neither JSON nor seed file
    EXPECT_TRUE(list["stations"].isArray());
    EXPECT_EQ(";0", Names(list));
    ASSERT_EQ(0, h.WriteFile(TARN_ASX_DEFAULT, "<Entry>\n<TITLE>Seed One</TITLE>\n<Ref href=\"http://one\"/>\n"
                                               "</Entry>\n<Entry>\n<TITLE>Seed Two</TITLE>\n"
                                               "<Ref href=\"http://two\"/>\n</Entry>\n"));
    ASSERT_EQ(0, RadioListGet(2, list));
    EXPECT_EQ("Seed One,Seed Two,;2", Names(list));
    EXPECT_FALSE(h.Exists(kFav));  // read, not adopted
    ASSERT_EQ(0, RadioListGet(1, list));  // the user-defined list has its own seed
    EXPECT_EQ(";0", Names(list));

    // A JSON file wins over the seed file; bit rates become bits per second.
    ASSERT_EQ(0, h.WriteFile(kFav, "// by hand\n{\"stations\": [{\"name\": \"Mine\", \"bitrate\": \"320\"},"
                                   "{\"name\": \"K\", \"bitrate\": \"64k\"}, {\"name\": \"N\", \"bitrate\": 96},"
                                   "{\"name\": \"F\", \"bitrate\": \"fast\"}], \"total\": 4}\n"));
    ASSERT_EQ(0, RadioListGet(2, list));
    EXPECT_EQ("Mine,K,N,F,;4", Names(list));
    std::string rates;
    for (const Json::Value &st : list["stations"])
        rates += std::to_string(st["bitrate"].asInt()) + " ";
    EXPECT_EQ("320000 64000 96 0 ", rates);

    ASSERT_EQ(0, h.WriteFile(kFav, "{\"stations\": [ broken"));
    EXPECT_EQ(-1, RadioListGet(2, list));
    EXPECT_EQ(1, h.CountLog("Failed to parse json file [" + h.Path(kFav) + "]"));
    EXPECT_EQ(-1, RadioListGet(5, list));
}

TEST_F(RadioListTest, AddEditAndDelete)
{
    // Add: the seed list is the start while no JSON file exists.
    Json::Value more(Json::arrayValue);
    more.append(Station("New A", "128"));
    more.append(Station("New B"));
    ASSERT_EQ(0, h.WriteFile(TARN_ASX_MANUAL, "<Entry>\n<TITLE>Seed</TITLE>\n<Ref href=\"http://seed\"/>\n</Entry>\n"));
    ASSERT_EQ(0, RadioListAdd(1, more));
    EXPECT_EQ("Seed,New A,New B,;3", Names(Saved(kUser)));
    ASSERT_EQ(0, h.WriteFile(kFav, "not json"));
    EXPECT_EQ(-1, RadioListAdd(2, more));  // an unreadable list is left alone
    EXPECT_EQ("not json", h.ReadFile(kFav));

    // Edit: name, url and desc only; index == size appends, "total" stays.
    Json::Value list = MakeList(3);
    list["stations"][1]["bitrate"] = "128";
    list["owner"] = "kept";
    Save(kFav, list);
    Json::Value edit = Station("Renamed", "999");
    ASSERT_EQ(0, RadioListEdit(2, 1, edit));
    Json::Value saved = Saved(kFav);
    EXPECT_EQ("http://s/Renamed", saved["stations"][1]["url"].asString());
    EXPECT_EQ("Renamed desc", saved["stations"][1]["desc"].asString());
    EXPECT_EQ(128000, saved["stations"][1]["bitrate"].asInt());
    EXPECT_EQ("kept", saved["owner"].asString());
    ASSERT_EQ(0, RadioListEdit(2, 3, edit));
    EXPECT_EQ("S0,Renamed,S2,Renamed,;3", Names(Saved(kFav)));
    std::string before = h.ReadFile(kFav);
    EXPECT_EQ(-1, RadioListEdit(2, 5, edit));
    EXPECT_EQ(1, h.CountLog("Bad index: 5"));
    EXPECT_EQ(before, h.ReadFile(kFav));
    EXPECT_EQ(0, RadioListEdit(1, 0, Json::Value("text")));  // no crash

    // Delete: duplicates and out-of-range indexes ignored; selections sort
    // by text ("10" before "2"); kept stations carry a null "destroy".
    Save(kFav, MakeList(4));
    ASSERT_EQ(0, RadioListDelete(2, "2,0,0"));
    saved = Saved(kFav);
    EXPECT_EQ("S1,S3,;2", Names(saved));
    EXPECT_TRUE(saved["stations"][0].isMember("destroy"));
    ASSERT_EQ(0, RadioListDelete(2, "7,-1,4294967295,99999999999"));
    EXPECT_EQ("S1,S3,;2", Names(Saved(kFav)));
    Save(kFav, MakeList(12));
    ASSERT_EQ(0, RadioListDelete(2, "2,10,11"));
    EXPECT_EQ("S0,S1,S3,S4,S5,S6,S7,S8,S9,;9", Names(Saved(kFav)));
    ASSERT_EQ(0, RadioListDelete(2, ",,"));
    EXPECT_EQ(1, h.CountLog("There is no selected item."));
    ASSERT_EQ(0, unlink(h.Path(kUser).c_str()) | unlink(h.Path(TARN_ASX_MANUAL).c_str()));
    ASSERT_EQ(0, RadioListDelete(1, "0"));  // empty list: nothing written
    EXPECT_FALSE(h.Exists(kUser));
}

// A damaged file whose member names hold NUL bytes: "stations\0..." must not
// be written as a second "stations" member that shadows the stations added.
TEST_F(RadioListTest, NulInMemberNamesDoesNotShadowTheStations)
{
    ASSERT_EQ(0, h.WriteFile(kUser, std::string("{\"stations") + std::string(3, '\0') +
                                        "\":\"128\",\"total\":0,\"stations\":[{\"name\":\"A\","
                                        "\"url\":\"http://a/\",\"x" + std::string(1, '\0') + "y\":1}]}"));
    Json::Value add(Json::arrayValue);
    add.append(Station("Added"));
    ASSERT_EQ(0, RadioListAdd(RADIO_LIST_USERDEF, add));
    EXPECT_EQ(std::string::npos, h.ReadFile(kUser).find('\0'));
    EXPECT_EQ("A,Added,;2", Names(Saved(kUser)));
    Json::Value list;
    ASSERT_EQ(0, RadioListGet(RADIO_LIST_USERDEF, list));  // as the daemon reads it
    EXPECT_EQ("A,Added,;2", Names(list));
}

}  // namespace
