// The text of control replies: any JSON value written whole, and a queue
// page written straight from the queue, which must read exactly as the
// page's JSON value written and cut to a reply's size.
#include <gtest/gtest.h>
#include <json/json.h>

#include <cmath>
#include <cstdio>
#include <cstring>
#include <limits>
#include <string>

#include "platform/json_text.h"
#include "player/playlist_page.h"

namespace {

Json::Value Parse(const std::string &text)
{
    Json::Value v;
    Json::CharReaderBuilder b;
    std::string errors;
    std::unique_ptr<Json::CharReader> r(b.newCharReader());
    EXPECT_TRUE(r->parse(text.data(), text.data() + text.size(), &v, &errors)) << errors << "\n" << text;
    return v;
}

TEST(ReplyText, ValuesRoundTripWithTheirLayout)
{
    EXPECT_EQ("null\n", JsonText(Json::Value()));
    EXPECT_EQ("{}\n", JsonText(Json::Value(Json::objectValue)));

    Json::Value v;
    v["b"] = 1;
    v["a"]["list"].append("x");
    v["a"]["list"].append(Json::Value(Json::arrayValue));
    EXPECT_EQ("{\n   \"a\": {\n      \"list\": [\n         \"x\",\n         []\n      ]\n   },\n   \"b\": 1\n}\n",
              JsonText(v));

    // Texts: UTF-8 and bytes that are not UTF-8 as they are, quotes,
    // backslashes and control characters escaped, NUL kept.
    Json::Value s;
    s["utf8"] = "Motörhead – 東京";
    s["raw"] = "\xff\xfe bad";
    s["escapes"] = "q\"b\\n\nt\tc\x01";
    s["nul"] = Json::Value(std::string("a\0b", 3));
    s["key \"quoted\""] = true;
    // Numbers of every kind; those that are not finite become null.
    s["big"] = Json::UInt64(18446744073709551615ULL);
    s["neg"] = Json::Int64(-9223372036854775807LL - 1);
    s["half"] = 0.5;
    s["nan"] = std::nan("");
    s["inf"] = std::numeric_limits<double>::infinity();
    std::string text = JsonText(s);
    EXPECT_NE(std::string::npos, text.find("\"Motörhead – 東京\"")) << text;
    EXPECT_NE(std::string::npos, text.find("\"\xff\xfe bad\"")) << text;
    EXPECT_NE(std::string::npos, text.find("\"q\\\"b\\\\n\\nt\\tc\\u0001\"")) << text;
    EXPECT_NE(std::string::npos, text.find("\"a\\u0000b\"")) << text;
    EXPECT_NE(std::string::npos, text.find("\"nan\": null")) << text;
    EXPECT_NE(std::string::npos, text.find("\"inf\": null")) << text;
    s.removeMember("raw");  // the reader refuses what is not UTF-8
    s["nan"] = Json::Value();
    s["inf"] = Json::Value();
    EXPECT_EQ(s, Parse(JsonText(s)));
}

class PageText : public ::testing::Test {
protected:
    Playlist queue;
    void Add(const char *path, const char *title, const char *artist, uint64_t size)
    {
        TARN_MEDIA_INFO info;
        memset(&info, 0, sizeof(info));
        info.id = static_cast<uint32_t>(queue.Count() + 7);
        snprintf(info.path, sizeof(info.path), "%s", path);
        snprintf(info.title, sizeof(info.title), "%s", title);
        snprintf(info.artist, sizeof(info.artist), "%s", artist);
        snprintf(info.album, sizeof(info.album), "Album \"%u\"", queue.Count());
        info.duration = 215.9f;
        info.bitrate = 320000;
        info.sample = 44100;
        info.channels = 2;
        info.track = static_cast<int32_t>(queue.Count() + 1);
        info.year = 1999;
        info.size = size;
        ASSERT_EQ(0, queue.AddSong(&info));
    }
    // The page's value written and cut by whole entries to most characters.
    std::string Reference(int start, int limit, size_t most)
    {
        Json::Value page;
        EXPECT_EQ(0, PlaylistListJson(queue, start, limit, page));
        Json::Value all = page["uris"];
        std::string text = JsonText(page);
        while (text.size() > most && page["uris"].size() > 0) {
            Json::Value removed;
            page["uris"].removeIndex(page["uris"].size() - 1, &removed);
            text = JsonText(page);
        }
        return text;
    }
};

TEST_F(PageText, ReadsAsThePageValue)
{
    std::string empty;
    ASSERT_EQ(0, PlaylistPageText(queue, 0, 10, 8191, &empty));
    EXPECT_EQ(Reference(0, 10, 8191), empty);
    EXPECT_TRUE(Parse(empty)["uris"].isArray());

    // Titles taken from the path when missing, texts that need escaping,
    // bytes that are not UTF-8, the largest size.
    Add("/music/a/01 First.mp3", "", "Ann", 1);
    Add("/music/b/", "", "Bob \"the\" \\ one\n", 18446744073709551615ULL);
    Add("/music/c.flac", "Motörhead \x01\xff", "", 0);
    Add("", "", "", 5);
    queue.SetCurrent(2);
    queue.ToggleShuffle();
    for (int mode : {1, 2, 3, 9})
        for (int start : {-3, 0, 1, 3, 4, 100})
            for (int limit : {-1, 0, 1, 2, 64, 65, 1 << 30}) {
                SCOPED_TRACE(testing::Message() << mode << " " << start << " " << limit);
                queue.SetMode(mode);
                std::string text;
                ASSERT_EQ(0, PlaylistPageText(queue, start, limit, 100000, &text));
                EXPECT_EQ(Reference(start, limit, 100000), text);
            }
    std::string text;
    ASSERT_EQ(0, PlaylistPageText(queue, 0, 2, 100000, &text));  // without the bytes that are not UTF-8
    Json::Value v = Parse(text);
    EXPECT_EQ("01 First.mp3", v["uris"][0]["title"].asString());
    EXPECT_EQ("/music/b/", v["uris"][1]["title"].asString());
    EXPECT_EQ("Bob \"the\" \\ one\n", v["uris"][1]["artist"].asString());
    EXPECT_EQ("18446744073709551615", v["uris"][1]["size"].asString());
}

TEST_F(PageText, KeepsTheMostWholeEntriesThatFit)
{
    for (int i = 0; i < 70; ++i) {
        std::string path = "/music/" + std::string(static_cast<size_t>(i % 13) * 9, 'x') + std::to_string(i);
        Add(path.c_str(), "", "Someone", static_cast<uint64_t>(i));
    }
    std::string head;
    ASSERT_EQ(0, PlaylistPageText(queue, 0, 0, 100000, &head));
    // Every limit from "nothing fits" to "everything fits".
    for (size_t most = 100; most <= head.size() + 1; most += 97) {
        SCOPED_TRACE(most);
        std::string text;
        ASSERT_EQ(0, PlaylistPageText(queue, 3, 0, most, &text));
        EXPECT_EQ(Reference(3, 0, most), text);
    }
    std::string reply;
    ASSERT_EQ(0, PlaylistPageText(queue, 10, 50, 8191, &reply));
    EXPECT_LE(reply.size(), 8191u);
    Json::Value v = Parse(reply);
    ASSERT_GT(v["uris"].size(), 5u);
    EXPECT_LT(v["uris"].size(), 50u);
    EXPECT_EQ(10, v["uris"][0]["sequence"].asInt());
    EXPECT_EQ(70, v["total"].asInt());
    EXPECT_EQ(-1, PlaylistPageText(queue, 0, 0, 8191, nullptr));
}

}  // namespace
