// Which files the local player can play.
#include <gtest/gtest.h>

#include <algorithm>
#include <cctype>
#include <string>
#include <vector>

#include "audio/info.h"

namespace {

const std::vector<std::string> kFull = {"mp3", "m4a", "ogg", "aac", "wma", "flac", "aiff", "aif", "mp1",
                                        "mp2", "mpa", "wav", "ac3", "ra",  "ram", "m4p",  "m4b",  "ape"};
const std::vector<std::string> kShort = {"mp3", "m4a", "m4b"};

std::string Upper(std::string s)
{
    std::transform(s.begin(), s.end(), s.begin(), [](unsigned char c) { return std::toupper(c); });
    return s;
}

TEST(SupportedFile, FullListInAnyCase)
{
    for (const std::string &ext : kFull) {
        for (const std::string &e : {ext, Upper(ext)}) {
            std::string path = "/music/a.b/song." + e;
            EXPECT_EQ(1, AudioIsSupportedFile(1, path.c_str())) << path;
            EXPECT_EQ(1, AudioIsSupportedFile(3, path.c_str())) << path;
            EXPECT_EQ(1, AudioIsSupportedFile(-1, path.c_str())) << path;
            bool inShort = std::find(kShort.begin(), kShort.end(), ext) != kShort.end();
            EXPECT_EQ(inShort ? 1 : 0, AudioIsSupportedFile(2, path.c_str())) << path;
        }
    }
    EXPECT_EQ(1, AudioIsSupportedFile(1, "song.FLAC"));
    EXPECT_EQ(0, AudioIsSupportedFile(2, "song.flac"));
    EXPECT_EQ(1, AudioIsSupportedFile(2, "Song.M4b"));
}

TEST(SupportedFile, OtherTypesAndOddPaths)
{
    const char *refused[] = {"song.mp4", "song.txt", "song.mp3x", "song.xmp3", "song.", "song",
                             "/music.mp3/song", "/music/mp3", "", "song.mp3.jpg", "song.m3u",
                             "HTTP://radio/stream", "ftp://host/song"};
    for (const char *p : refused) {
        EXPECT_EQ(0, AudioIsSupportedFile(1, p)) << p;
        EXPECT_EQ(0, AudioIsSupportedFile(2, p)) << p;
    }
    EXPECT_EQ(1, AudioIsSupportedFile(1, "song.jpg.mp3"));
    EXPECT_EQ(1, AudioIsSupportedFile(1, ".ogg"));
    EXPECT_EQ(0, AudioIsSupportedFile(1, nullptr));
    EXPECT_EQ(0, AudioIsSupportedFile(2, nullptr));
}

TEST(SupportedFile, StreamsAndModeZeroAreAlwaysAccepted)
{
    EXPECT_EQ(1, AudioIsSupportedFile(1, "http://radio.example/stream"));
    EXPECT_EQ(1, AudioIsSupportedFile(2, "https://radio.example/listen.pls"));
    EXPECT_EQ(1, AudioIsSupportedFile(1, "httpfoo"));
    EXPECT_EQ(1, AudioIsSupportedFile(0, "song.txt"));
    EXPECT_EQ(1, AudioIsSupportedFile(0, "noextension"));
    EXPECT_EQ(1, AudioIsSupportedFile(0, nullptr));
}

}  // namespace
