// Radio station lists: paths and genres, the one-day staleness rule, bit-rate
// normalisation, the ASX fallback, and the edits with their quirks.
#include <gtest/gtest.h>

#include <cerrno>
#include <ctime>
#include <string>
#include <sys/stat.h>
#include <unistd.h>
#include <utime.h>

#include <json/json.h>

#include "source/asxparse.h"
#include "source/radiolist.h"
#include "tests/harness/harness.h"

namespace {

Json::Value MakeStation(const std::string &name, const std::string &url, const char *bitrate = nullptr)
{
    Json::Value s(Json::objectValue);
    s["name"] = name;
    s["url"] = url;
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
        list["stations"].append(MakeStation("S" + std::to_string(i), "http://s/" + std::to_string(i)));
    list["total"] = n;
    return list;
}

std::string Styled(const Json::Value &v)
{
    Json::StyledWriter w;
    return w.write(v);
}

Json::Value ParseText(const std::string &text)
{
    Json::Value v;
    Json::Reader r;
    EXPECT_TRUE(r.parse(text, v, true)) << text;
    return v;
}

class RadioListTest : public ::testing::Test {
protected:
    tarntest::Harness h;

    // Sets the modification time of a root file to now - age seconds.
    void Age(const char *fixedPath, long age)
    {
        struct utimbuf t;
        t.actime = t.modtime = time(nullptr) - age;
        ASSERT_EQ(0, utime(h.Path(fixedPath).c_str(), &t));
    }
    std::vector<std::string> Names(const Json::Value &list)
    {
        std::vector<std::string> names;
        for (const Json::Value &s : list["stations"])
            names.push_back(s["name"].asString());
        return names;
    }
};

TEST_F(RadioListTest, PathsOfTheLists)
{
    std::string p;
    ASSERT_EQ(0, RadioListPath(1, p));
    EXPECT_EQ(h.Path("/usr/tarn/etc/audio/radio/userdef.json"), p);
    ASSERT_EQ(0, RadioListPath(2, p));
    EXPECT_EQ(h.Path("/usr/tarn/etc/audio/radio/favorite.json"), p);
    p = "unchanged";
    EXPECT_EQ(-1, RadioListPath(0, p));
    EXPECT_EQ(-1, RadioListPath(3, p));
    EXPECT_EQ("unchanged", p);
    ASSERT_EQ(0, RadioioJsonPath(p));
    EXPECT_EQ(h.Path("/usr/tarn/etc/audio/radio/radioio.json"), p);
    ASSERT_EQ(0, ShoutcastJsonPath(8, p));
    EXPECT_EQ(h.Path("/usr/tarn/etc/audio/radio/shoutcast_Hip Hop.json"), p);
    ASSERT_EQ(0, ShoutcastJsonPath(18, p));
    EXPECT_EQ(h.Path("/usr/tarn/etc/audio/radio/shoutcast_R&B.json"), p);

    h.ClearLog();
    EXPECT_EQ(-1, ShoutcastJsonPath(26, p));
    EXPECT_EQ(-1, ShoutcastJsonPath(-1, p));
    EXPECT_EQ(1, h.CountLog("Bad parameter. Index [26] out of range [0:26]"));
    EXPECT_EQ(1, h.CountLog("Bad parameter. Index [-1] out of range [0:26]"));
}

TEST_F(RadioListTest, GenreLookupAndList)
{
    EXPECT_EQ(-1, ShoutcastGenreIndex("Easy"));
    EXPECT_EQ(5, ShoutcastGenreIndex("Easy Listening"));
    EXPECT_EQ(18, ShoutcastGenreIndex("R&B"));
    EXPECT_EQ(-1, ShoutcastGenreIndex("rock"));
    EXPECT_EQ(21, ShoutcastGenreIndex("Rock"));
    EXPECT_EQ(0, ShoutcastGenreIndex("Alternative"));
    EXPECT_EQ(25, ShoutcastGenreIndex("Themes"));
    h.ClearLog();
    EXPECT_EQ(-1, ShoutcastGenreIndex(nullptr));
    EXPECT_EQ(1, h.CountLog("radiolist:"));

    Json::Value genres;
    ASSERT_EQ(0, ShoutcastGenreList(genres));
    ASSERT_EQ(26u, genres.size());
    EXPECT_EQ("Alternative", genres[0].asString());
    EXPECT_EQ("Hip Hop", genres[8].asString());
    EXPECT_EQ("Themes", genres[25].asString());
    for (Json::ArrayIndex i = 0; i < genres.size(); i++)
        EXPECT_EQ(static_cast<int>(i), ShoutcastGenreIndex(genres[i].asCString()));
}

TEST_F(RadioListTest, StalenessBoundaryIsOneFullDay)
{
    const char *file = "/usr/tarn/etc/audio/radio/radioio.json";
    std::string path = h.Path(file);
    EXPECT_EQ(1, RadioListIsStale(path.c_str()));  // missing
    ASSERT_EQ(0, h.WriteFile(file, "{}"));
    EXPECT_EQ(0, RadioListIsStale(path.c_str()));
    Age(file, 86399);
    EXPECT_EQ(0, RadioListIsStale(path.c_str()));
    Age(file, 86400);
    EXPECT_EQ(1, RadioListIsStale(path.c_str()));
    Age(file, 3 * 86400);
    EXPECT_EQ(1, RadioListIsStale(path.c_str()));
    Age(file, -86400 * 10);  // in the future: fresh
    EXPECT_EQ(0, RadioListIsStale(path.c_str()));

    // A path that cannot be looked at (not ENOENT) is logged and stale.
    ASSERT_EQ(0, h.WriteFile("/tmp/plain", "x"));
    h.ClearLog();
    std::string under = h.Path("/tmp/plain") + "/radioio.json";
    EXPECT_EQ(1, RadioListIsStale(under.c_str()));
    EXPECT_EQ(1, h.CountLog("Failed to stat [" + under + "]"));
    h.ClearLog();
    EXPECT_EQ(1, RadioListIsStale(h.Path("/tmp/absent.json").c_str()));
    EXPECT_EQ(0, h.CountLog("Failed to stat"));
}

TEST_F(RadioListTest, BitratesBecomeBitsPerSecond)
{
    Json::Value list = ParseText(R"({"stations": [
        {"name": "a", "bitrate": "128"},
        {"name": "b", "bitrate": 96},
        {"name": "c"},
        {"name": "d", "bitrate": "64k"},
        {"name": "e", "bitrate": "fast"}], "total": 5})");
    NormalizeBitrates(list);
    EXPECT_TRUE(list["stations"][0]["bitrate"].isIntegral());
    EXPECT_EQ(128000, list["stations"][0]["bitrate"].asInt());
    EXPECT_EQ(96, list["stations"][1]["bitrate"].asInt());
    EXPECT_TRUE(list["stations"][2].isMember("bitrate"));
    EXPECT_TRUE(list["stations"][2]["bitrate"].isNull());
    EXPECT_EQ(64000, list["stations"][3]["bitrate"].asInt());
    EXPECT_EQ(0, list["stations"][4]["bitrate"].asInt());

    // Lists of other shapes are left alone, without a crash.
    Json::Value odd = ParseText(R"({"stations": ["text", 3, null]})");
    NormalizeBitrates(odd);
    EXPECT_EQ("text", odd["stations"][0].asString());
    Json::Value array = ParseText("[1, 2]");
    NormalizeBitrates(array);
    EXPECT_EQ(2u, array.size());
}

TEST_F(RadioListTest, ReadFallsBackToSeedFileThenToEmptyList)
{
    Json::Value list;
    // Neither JSON nor ASX file: empty list, still success.
    ASSERT_EQ(0, RadioListGet(2, list));
    EXPECT_TRUE(list["stations"].isArray());
    EXPECT_EQ(0u, list["stations"].size());
    EXPECT_EQ(0, list["total"].asInt());

    ASSERT_EQ(0, h.WriteFile(TARN_ASX_DEFAULT,
                             "<Entry>\n<TITLE>Seed One</TITLE>\n<Ref href=\"http://one\"/>\n</Entry>\n"
                             "<Entry>\n<TITLE>Seed Two</TITLE>\n<Ref href=\"http://two\"/>\n</Entry>\n"));
    list = Json::Value();
    ASSERT_EQ(0, RadioListGet(2, list));
    EXPECT_EQ((std::vector<std::string>{"Seed One", "Seed Two"}), Names(list));
    EXPECT_EQ(2, list["total"].asInt());
    // Read, not adopted: no JSON file appears.
    EXPECT_FALSE(h.Exists("/usr/tarn/etc/audio/radio/favorite.json"));
    // The user-defined list has its own seed file, still missing.
    list = Json::Value();
    ASSERT_EQ(0, RadioListGet(1, list));
    EXPECT_EQ(0u, list["stations"].size());

    // Once a JSON file exists it wins over the seed file.
    ASSERT_EQ(0, h.WriteFile("/usr/tarn/etc/audio/radio/favorite.json",
                             "// saved by hand\n{\"stations\": [{\"name\": \"Mine\", \"url\": \"http://m\","
                             " \"bitrate\": \"320\"}], \"total\": 1}\n"));
    list = Json::Value();
    ASSERT_EQ(0, RadioListGet(2, list));
    EXPECT_EQ((std::vector<std::string>{"Mine"}), Names(list));
    EXPECT_EQ(320000, list["stations"][0]["bitrate"].asInt());

    h.ClearLog();
    ASSERT_EQ(0, h.WriteFile("/usr/tarn/etc/audio/radio/favorite.json", "{\"stations\": [ broken"));
    EXPECT_EQ(-1, RadioListGet(2, list));
    EXPECT_EQ(1, h.CountLog("Failed to parse json file [" + h.Path("/usr/tarn/etc/audio/radio/favorite.json") + "]"));
    h.ClearLog();
    EXPECT_EQ(-1, RadioListGet(5, list));
    EXPECT_EQ(1, h.CountLog("Could not find the path of type: 5"));
}

TEST_F(RadioListTest, RadioioListWithoutDirectoryStaysMissing)
{
    // No directory URL configured: the updater writes nothing and the read
    // fails on the missing file.
    Json::Value list;
    h.ClearLog();
    EXPECT_EQ(-1, RadioioListGet(list, false));
    EXPECT_EQ(1, h.CountLog("Failed to parse json file"));
    EXPECT_FALSE(h.Exists("/usr/tarn/etc/audio/radio/radioio.json"));

    // A stale file is kept and read as it is when no fetch is possible.
    ASSERT_EQ(0, h.WriteFile("/usr/tarn/etc/audio/radio/radioio.json",
                             "{\"stations\": [{\"name\": \"Old\", \"url\": \"http://old\", \"bitrate\": \"64\"}],"
                             " \"total\": 1}"));
    Age("/usr/tarn/etc/audio/radio/radioio.json", 5 * 86400);
    ASSERT_EQ(0, RadioioListGet(list, false));
    EXPECT_EQ(64000, list["stations"][0]["bitrate"].asInt());
    ASSERT_EQ(0, RadioioListGet(list, true));
    EXPECT_EQ("Old", list["stations"][0]["name"].asString());

    EXPECT_EQ(-1, ShoutcastListGet(26, list, false));
    h.ClearLog();
    EXPECT_EQ(-1, ShoutcastListGetByGenre("Easy", list, false));
    EXPECT_EQ(1, h.CountLog("Failed to get SHOUTcast index by genre [Easy]"));
    ASSERT_EQ(0, h.WriteFile("/usr/tarn/etc/audio/radio/shoutcast_R&B.json",
                             "{\"stations\": [{\"name\": \"Soul\", \"url\": \"http://soul\"}], \"total\": 1}"));
    ASSERT_EQ(0, ShoutcastListGetByGenre("R&B", list, false));
    EXPECT_EQ("Soul", list["stations"][0]["name"].asString());
}

TEST_F(RadioListTest, SaveCreatesTheRadioDirectoryAndWritesStyledText)
{
    std::string dir = h.Path("/usr/tarn/etc/audio/radio");
    struct stat st;
    ASSERT_NE(0, stat(dir.c_str(), &st));
    Json::Value list = MakeList(2);

    // Another missing directory: only the radio directory is created, and
    // the second attempt still fails.
    h.ClearLog();
    std::string elsewhere = h.Path("/usr/tarn/other/list.json");
    EXPECT_EQ(-1, RadioListSave(elsewhere.c_str(), list));
    EXPECT_EQ(1, h.CountLog("Failed to fopen [" + elsewhere + "] after mkdir"));
    ASSERT_EQ(0, stat(dir.c_str(), &st));
    EXPECT_EQ(0644u, st.st_mode & 07777);
    // The radio directory exists now: a further miss fails at mkdir.
    EXPECT_EQ(-1, RadioListSave(elsewhere.c_str(), list));
    EXPECT_EQ(1, h.CountLog("Failed to mkdir [" + dir + "]"));
    ASSERT_EQ(0, rmdir(dir.c_str()));

    std::string path = dir + "/favorite.json";
    ASSERT_EQ(0, RadioListSave(path.c_str(), list));
    ASSERT_EQ(0, stat(dir.c_str(), &st));
    EXPECT_TRUE(S_ISDIR(st.st_mode));
    EXPECT_EQ(0644u, st.st_mode & 07777);
    EXPECT_EQ(Styled(list), h.ReadFile("/usr/tarn/etc/audio/radio/favorite.json"));
    // Nothing else is left in the directory.
    std::string out;
    ASSERT_EQ(0, h.Run({"/bin/ls", "-A", dir}, &out));
    EXPECT_EQ("favorite.json\n", out);
    // Replacing keeps the file's name and gives the new text.
    Json::Value bigger = MakeList(5);
    ASSERT_EQ(0, RadioListSave(path.c_str(), bigger));
    EXPECT_EQ(Styled(bigger), h.ReadFile("/usr/tarn/etc/audio/radio/favorite.json"));

    h.ClearLog();
    EXPECT_EQ(-1, RadioListSave(nullptr, list));
    EXPECT_EQ(1, h.CountLog("Bad parameter."));
}

TEST_F(RadioListTest, AddAppendsAndCounts)
{
    Json::Value more(Json::arrayValue);
    more.append(MakeStation("New A", "http://a", "128"));
    more.append(MakeStation("New B", "http://b"));
    ASSERT_EQ(0, h.WriteFile(TARN_ASX_MANUAL,
                             "<Entry>\n<TITLE>Seed</TITLE>\n<Ref href=\"http://seed\"/>\n</Entry>\n"));
    // The seed list is the starting point while no JSON file exists.
    ASSERT_EQ(0, RadioListAdd(1, more));
    Json::Value saved = ParseText(h.ReadFile("/usr/tarn/etc/audio/radio/userdef.json"));
    EXPECT_EQ((std::vector<std::string>{"Seed", "New A", "New B"}), Names(saved));
    EXPECT_EQ(3, saved["total"].asInt());
    ASSERT_EQ(0, RadioListAdd(1, more));
    saved = ParseText(h.ReadFile("/usr/tarn/etc/audio/radio/userdef.json"));
    EXPECT_EQ(5, saved["total"].asInt());
    // Bit rates are written back as read (bits per second).
    EXPECT_EQ(128000, saved["stations"][1]["bitrate"].asInt());

    h.ClearLog();
    EXPECT_EQ(-1, RadioListAdd(7, more));
    EXPECT_EQ(1, h.CountLog("Could not find the path of type: 7"));
    ASSERT_EQ(0, h.WriteFile("/usr/tarn/etc/audio/radio/favorite.json", "not json"));
    EXPECT_EQ(-1, RadioListAdd(2, more));
    EXPECT_EQ(1, h.CountLog("Could not get the list of type: 2"));
    EXPECT_EQ("not json", h.ReadFile("/usr/tarn/etc/audio/radio/favorite.json"));
}

TEST_F(RadioListTest, EditChangesThreeMembersAndMayAppend)
{
    Json::Value list = MakeList(3);
    list["stations"][1]["bitrate"] = "128";
    list["stations"][1]["extra"] = "kept";
    list["owner"] = "kept too";
    ASSERT_EQ(0, RadioListSave(h.Path("/usr/tarn/etc/audio/radio/favorite.json").c_str(), list));

    Json::Value edit(Json::objectValue);
    edit["name"] = "Renamed";
    edit["url"] = "http://renamed";
    edit["desc"] = "new desc";
    edit["bitrate"] = "999";  // not copied
    ASSERT_EQ(0, RadioListEdit(2, 1, edit));
    Json::Value saved = ParseText(h.ReadFile("/usr/tarn/etc/audio/radio/favorite.json"));
    EXPECT_EQ("Renamed", saved["stations"][1]["name"].asString());
    EXPECT_EQ("http://renamed", saved["stations"][1]["url"].asString());
    EXPECT_EQ("new desc", saved["stations"][1]["desc"].asString());
    EXPECT_EQ(128000, saved["stations"][1]["bitrate"].asInt());
    EXPECT_EQ("kept", saved["stations"][1]["extra"].asString());
    EXPECT_EQ("kept too", saved["owner"].asString());

    // Index equal to the size appends; "total" stays.
    ASSERT_EQ(0, RadioListEdit(2, 3, edit));
    saved = ParseText(h.ReadFile("/usr/tarn/etc/audio/radio/favorite.json"));
    EXPECT_EQ(4u, saved["stations"].size());
    EXPECT_EQ(3, saved["total"].asInt());
    EXPECT_EQ("Renamed", saved["stations"][3]["name"].asString());

    h.ClearLog();
    std::string before = h.ReadFile("/usr/tarn/etc/audio/radio/favorite.json");
    EXPECT_EQ(-1, RadioListEdit(2, 5, edit));
    EXPECT_EQ(1, h.CountLog("Bad index: 5"));
    EXPECT_EQ(before, h.ReadFile("/usr/tarn/etc/audio/radio/favorite.json"));

    // An unreadable list is logged and the edit goes on from an empty one.
    ASSERT_EQ(0, h.WriteFile("/usr/tarn/etc/audio/radio/userdef.json", "garbage"));
    h.ClearLog();
    ASSERT_EQ(0, RadioListEdit(1, 0, edit));
    EXPECT_EQ(1, h.CountLog("Could not get the list of type: 1"));
    saved = ParseText(h.ReadFile("/usr/tarn/etc/audio/radio/userdef.json"));
    EXPECT_EQ((std::vector<std::string>{"Renamed"}), Names(saved));
    // A station that is not an object does not crash the edit.
    EXPECT_EQ(0, RadioListEdit(1, 0, Json::Value("text")));
}

TEST_F(RadioListTest, DeleteSelectionQuirks)
{
    const char *file = "/usr/tarn/etc/audio/radio/favorite.json";
    Json::Value list = MakeList(4);
    list["owner"] = "dropped";
    ASSERT_EQ(0, RadioListSave(h.Path(file).c_str(), list));

    ASSERT_EQ(0, RadioListDelete(2, "2,0,0"));
    Json::Value saved = ParseText(h.ReadFile(file));
    EXPECT_EQ((std::vector<std::string>{"S1", "S3"}), Names(saved));
    EXPECT_EQ(2, saved["total"].asInt());
    EXPECT_FALSE(saved.isMember("owner"));
    // Kept stations carry a null "destroy" member.
    EXPECT_TRUE(saved["stations"][0].isMember("destroy"));
    EXPECT_TRUE(saved["stations"][0]["destroy"].isNull());
    EXPECT_EQ(2u, saved.getMemberNames().size());

    // Out-of-range and odd selections remove nothing; the list is saved.
    ASSERT_EQ(0, RadioListSave(h.Path(file).c_str(), MakeList(3)));
    ASSERT_EQ(0, RadioListDelete(2, "7"));
    saved = ParseText(h.ReadFile(file));
    EXPECT_EQ(3u, saved["stations"].size());
    EXPECT_EQ(3, saved["total"].asInt());
    ASSERT_EQ(0, RadioListDelete(2, "-1,4294967295,99999999999"));
    saved = ParseText(h.ReadFile(file));
    EXPECT_EQ(3u, saved["stations"].size());

    h.ClearLog();
    ASSERT_EQ(0, RadioListDelete(2, ",,"));
    EXPECT_EQ(1, h.CountLog("There is no selected item."));
    ASSERT_EQ(0, RadioListDelete(2, ""));
    EXPECT_EQ(2, h.CountLog("There is no selected item."));

    // Sorting is by text: "10" sorts before "2", both are removed.
    ASSERT_EQ(0, RadioListSave(h.Path(file).c_str(), MakeList(12)));
    ASSERT_EQ(0, RadioListDelete(2, "2,10,11"));
    saved = ParseText(h.ReadFile(file));
    EXPECT_EQ(9u, saved["stations"].size());
    EXPECT_EQ("S3", saved["stations"][2]["name"].asString());
    EXPECT_EQ("S9", saved["stations"][8]["name"].asString());

    // An empty list: nothing to delete, nothing written.
    h.ClearLog();
    ASSERT_EQ(0, RadioListDelete(1, "0"));
    EXPECT_EQ(1, h.CountLog("No stations to delete."));
    EXPECT_FALSE(h.Exists("/usr/tarn/etc/audio/radio/userdef.json"));
    EXPECT_EQ(-1, RadioListDelete(9, "0"));
}

}  // namespace
