// Equalizer profiles: lookup in one file, the configured default profile,
// and the shipped system profiles.
#include <gtest/gtest.h>

#include <cstdio>
#include <fstream>
#include <memory>
#include <string>
#include <vector>

#include "audio/info.h"
#include "daemon/tarn_types.h"
#include "tests/harness/harness.h"

namespace {

const char kGainsA[] = "1.0 2.0 3.0 4.0 5.0 6.0 7.0 8.0 9.0 10.0";
const char kGainsB[] = "-1.0 -2.0 -3.0 -4.0 -5.0 -6.0 -7.0 -8.0 -9.0 -10.0";

class EqTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        harness.reset(new tarntest::Harness());
        ASSERT_EQ("", harness->Error());
        path = harness->Path("/tmp/profiles");
    }
    void Profiles(const std::string &text) { ASSERT_EQ(0, harness->WriteFile("/tmp/profiles", text)); }
    int Lookup(const char *name, std::string *gains = nullptr, size_t size = 256)
    {
        std::vector<char> out(size > 0 ? size : 1, '#');
        int rc = EqProfileLookup(path.c_str(), name, out.data(), size);
        if (gains)
            *gains = rc == 1 ? std::string(out.data()) : std::string("<none>");
        return rc;
    }
    void Conf(const std::string &text) { ASSERT_EQ(0, harness->WriteFile(TARN_INFO_CONF, text)); }
    int Default(std::string *gains)
    {
        char out[256];
        int rc = EqDefaultProfileGet(out, sizeof(out));
        *gains = rc == 1 ? std::string(out) : std::string("<none>");
        return rc;
    }
    std::unique_ptr<tarntest::Harness> harness;
    std::string path;
};

TEST_F(EqTest, FindsAProfileAndTrimsItsGains)
{
    Profiles(std::string("Flat:0.0 0.0 0.0 0.0 0.0 0.0 0.0 0.0 0.0 0.0\n") + "Jazz: \t" + kGainsA +
             "  \r\n" + "Rock:" + kGainsB + "\n");
    std::string gains;
    EXPECT_EQ(1, Lookup("Jazz", &gains));
    EXPECT_EQ(kGainsA, gains);
    EXPECT_EQ(1, Lookup("Rock", &gains));
    EXPECT_EQ(kGainsB, gains);
    EXPECT_EQ(1, Lookup("Flat", &gains));
    EXPECT_EQ(TARN_EQ_NEUTRAL, gains);
    EXPECT_EQ(0, Lookup("Pop", &gains));
    // The wanted name must be at least as long as the line's name.
    EXPECT_EQ(0, Lookup("Jaz"));
    EXPECT_EQ(0, Lookup(""));
    EXPECT_EQ(0, harness->CountLog("ctrl:"));
}

TEST_F(EqTest, LineNamesMatchAsPrefixesAndTheFirstMatchWins)
{
    Profiles(std::string("Ro:") + kGainsB + "\nRock:" + kGainsA + "\nRock:0.0\n");
    std::string gains;
    EXPECT_EQ(1, Lookup("Rock", &gains));
    EXPECT_EQ(kGainsB, gains);
    EXPECT_EQ(1, Lookup("Rococo", &gains));
    EXPECT_EQ(kGainsB, gains);
    // A line that begins with a colon matches any name.
    Profiles(std::string("Pop:") + kGainsA + "\n:" + kGainsB + "\n");
    EXPECT_EQ(1, Lookup("Pop", &gains));
    EXPECT_EQ(kGainsA, gains);
    EXPECT_EQ(1, Lookup("Anything", &gains));
    EXPECT_EQ(kGainsB, gains);
}

TEST_F(EqTest, TheLastColonSeparatesNameAndGains)
{
    Profiles(std::string("Live: Club:Night:") + kGainsA + "\n");
    std::string gains;
    EXPECT_EQ(1, Lookup("Live: Club:Night", &gains));
    EXPECT_EQ(kGainsA, gains);
    EXPECT_EQ(0, Lookup("Live: Club"));
}

TEST_F(EqTest, IllegalLinesAndMissingFiles)
{
    Profiles(std::string("Jazz:") + kGainsA + "\nno colon here\nRock:" + kGainsB + "\n");
    std::string gains;
    // Lines after the match are never read.
    EXPECT_EQ(1, Lookup("Jazz", &gains));
    EXPECT_EQ(0, harness->CountLog("is illegal"));
    EXPECT_EQ(-1, Lookup("Rock", &gains));
    EXPECT_EQ(1, harness->CountLog("ctrl:529 The EQ profile [no colon here] is illegal."));

    harness->ClearLog();
    path = harness->Path("/tmp/no-such-file");
    EXPECT_EQ(-1, Lookup("Jazz"));
    // An empty file holds no profile.
    path = harness->Path("/tmp/profiles");
    Profiles("");
    EXPECT_EQ(0, Lookup("Jazz"));
    EXPECT_EQ(-1, EqProfileLookup(nullptr, "Jazz", nullptr, 0));
    char out[8];
    EXPECT_EQ(-1, EqProfileLookup(path.c_str(), nullptr, out, sizeof(out)));
    EXPECT_EQ(-1, EqProfileLookup(path.c_str(), "Jazz", nullptr, 16));
    EXPECT_EQ(0, harness->CountLog("ctrl:"));
}

TEST_F(EqTest, LongLinesAndSmallBuffers)
{
    Profiles(std::string("Jazz:") + kGainsA + "\n");
    std::string gains;
    EXPECT_EQ(1, Lookup("Jazz", &gains, 8));
    EXPECT_EQ("1.0 2.0", gains);
    // A line longer than 1023 characters is read in pieces; no piece of this
    // one matches, and the piece without a colon ends the search.
    Profiles(std::string(1500, 'x') + ":" + kGainsA + "\nJazz:" + kGainsB + "\n");
    EXPECT_EQ(-1, Lookup("Jazz", &gains));
}

TEST_F(EqTest, DefaultProfileOnlyWhenEnabled)
{
    ASSERT_EQ(0, harness->WriteFile(TARN_EQ_SYSTEM_FILE, "illegal line\n"));
    std::string gains;
    // Without "yes" no profile file is opened (the illegal file is not seen).
    EXPECT_EQ(0, Default(&gains));
    Conf("audio_default_equalizer=Jazz\n");
    EXPECT_EQ(0, Default(&gains));
    Conf("audio_enable_equalizer=no\naudio_default_equalizer=Jazz\n");
    EXPECT_EQ(0, Default(&gains));
    Conf("audio_enable_equalizer=Yes\naudio_default_equalizer=Jazz\n");
    EXPECT_EQ(0, Default(&gains));
    Conf("audio_enable_equalizer=\"yes \"\naudio_default_equalizer=Jazz\n");
    EXPECT_EQ(0, Default(&gains));
    EXPECT_EQ(0, harness->CountLog("ctrl:"));
    // Enabled without a profile name.
    Conf("audio_enable_equalizer=yes\n");
    EXPECT_EQ(0, Default(&gains));
    EXPECT_EQ(0, harness->CountLog("ctrl:"));
}

TEST_F(EqTest, DefaultProfileFromSystemThenUserFile)
{
    Conf("audio_enable_equalizer=\"yes\"\naudio_default_equalizer=\"Jazz\"\n");
    ASSERT_EQ(0, harness->WriteFile(TARN_EQ_SYSTEM_FILE, std::string("Jazz:") + kGainsA + "\n"));
    ASSERT_EQ(0, harness->WriteFile(TARN_EQ_USER_FILE, std::string("Jazz:") + kGainsB + "\nMine:" + kGainsB + "\n"));
    std::string gains;
    EXPECT_EQ(1, Default(&gains));
    EXPECT_EQ(kGainsA, gains);

    Conf("audio_enable_equalizer=yes\naudio_default_equalizer=Mine\n");
    EXPECT_EQ(1, Default(&gains));
    EXPECT_EQ(kGainsB, gains);

    Conf("audio_enable_equalizer=yes\naudio_default_equalizer=Nowhere\n");
    EXPECT_EQ(0, Default(&gains));

    // No user file at all: the user lookup's error comes back unlogged.
    ASSERT_EQ(0, remove(harness->Path(TARN_EQ_USER_FILE).c_str()));
    EXPECT_EQ(-1, Default(&gains));
    EXPECT_EQ(0, harness->CountLog("ctrl:"));
}

TEST_F(EqTest, SystemFileFailureIsReportedAndUserFileIsNotConsulted)
{
    Conf("audio_enable_equalizer=yes\naudio_default_equalizer=Mine\n");
    ASSERT_EQ(0, harness->WriteFile(TARN_EQ_USER_FILE, std::string("Mine:") + kGainsB + "\n"));
    std::string gains;
    EXPECT_EQ(-1, Default(&gains));
    const std::string systemPath = harness->Path(TARN_EQ_SYSTEM_FILE);
    EXPECT_EQ(1, harness->CountLog("ctrl:586 Failed to open the system EQ profile [" + systemPath + "]."));

    // An illegal system line is reported the same way.
    harness->ClearLog();
    ASSERT_EQ(0, harness->WriteFile(TARN_EQ_SYSTEM_FILE, "broken\n"));
    EXPECT_EQ(-1, Default(&gains));
    EXPECT_EQ(1, harness->CountLog("ctrl:529 The EQ profile [broken] is illegal."));
    EXPECT_EQ(1, harness->CountLog("ctrl:586 Failed to open the system EQ profile"));
}

TEST_F(EqTest, ShippedSystemProfiles)
{
    std::ifstream in(tarntest::SourcePath("data/equalizer.system"));
    ASSERT_TRUE(in.good());
    std::string file((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    ASSERT_EQ(0, harness->WriteFile(TARN_EQ_SYSTEM_FILE, file));
    path = harness->Path(TARN_EQ_SYSTEM_FILE);

    std::vector<std::pair<std::string, std::string>> profiles;
    size_t pos = 0;
    while (pos < file.size()) {
        size_t end = file.find('\n', pos);
        ASSERT_NE(std::string::npos, end) << "last line ends with a line feed";
        std::string line = file.substr(pos, end - pos);
        pos = end + 1;
        size_t colon = line.rfind(':');
        ASSERT_NE(std::string::npos, colon) << line;
        profiles.emplace_back(line.substr(0, colon), line.substr(colon + 1));
    }
    ASSERT_GE(profiles.size(), 5u);
    EXPECT_EQ("Flat", profiles[0].first);
    EXPECT_EQ(TARN_EQ_NEUTRAL, profiles[0].second);
    for (const auto &p : profiles) {
        // Ten gains, each written "%3.1f", within the player's range.
        std::vector<std::string> parts;
        size_t s = 0;
        while (s <= p.second.size()) {
            size_t e = p.second.find(' ', s);
            if (e == std::string::npos)
                e = p.second.size();
            parts.push_back(p.second.substr(s, e - s));
            s = e + 1;
        }
        ASSERT_EQ(10u, parts.size()) << p.first;
        for (const std::string &g : parts) {
            double v = atof(g.c_str());
            char again[16];
            snprintf(again, sizeof(again), "%3.1f", v);
            EXPECT_EQ(g, again) << p.first;
            EXPECT_LE(v, 12.0);
            EXPECT_GE(v, -12.0);
        }
        // Every name reaches its own line: no earlier name is a prefix of it.
        std::string gains;
        EXPECT_EQ(1, Lookup(p.first.c_str(), &gains)) << p.first;
        EXPECT_EQ(p.second, gains) << p.first;
    }
}

}  // namespace
