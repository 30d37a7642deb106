// Renderer capability probe and the bounded description download, against
// recorded service descriptions served by a local fake device.
#include <gtest/gtest.h>

#include <chrono>
#include <fstream>
#include <sstream>
#include <string>
#include <thread>

#include "tests/tools/fakedevice/fake_device.h"
#include "upnp/get_capability.h"
#include "upnp/upnp.h"
#include "upnp/xml_util.h"

namespace {

std::string Fixture(const char *name)
{
    std::ifstream in(std::string(TARN_SOURCE_DIR) + "/tests/fixtures/upnp/" + name);
    std::stringstream ss;
    ss << in.rdbuf();
    return ss.str();
}

std::string Replace(std::string text, const std::string &from, const std::string &to)
{
    size_t pos = text.find(from);
    EXPECT_NE(std::string::npos, pos) << from;
    if (pos != std::string::npos)
        text.replace(pos, from.size(), to);
    return text;
}

struct Doc {
    IXML_Document *doc = nullptr;
    explicit Doc(const std::string &text)
    {
        EXPECT_EQ(IXML_SUCCESS, ixmlParseBufferEx(text.c_str(), &doc));
    }
    ~Doc()
    {
        if (doc != nullptr)
            ixmlDocument_free(doc);
    }
};

TEST(UpnpCapability, RecordedServiceDescriptions)
{
    Doc avt(Fixture("gmediarender_avtransport_scpd.xml"));
    Doc rcs(Fixture("gmediarender_renderingcontrol_scpd.xml"));
    EXPECT_TRUE(SupportsRelTimeSeek(avt.doc));
    EXPECT_TRUE(SupportsSetVolume(rcs.doc));
    // Each document answers only its own question.
    EXPECT_FALSE(SupportsRelTimeSeek(rcs.doc));
    EXPECT_FALSE(SupportsSetVolume(avt.doc));
    EXPECT_FALSE(SupportsRelTimeSeek(nullptr));
    EXPECT_FALSE(SupportsSetVolume(nullptr));
}

TEST(UpnpCapability, SeekNeedsTheActionAndRelTime)
{
    std::string avt = Fixture("gmediarender_avtransport_scpd.xml");
    // Seek only by track number or absolute time.
    Doc noRel(Replace(avt, "<allowedValue>REL_TIME</allowedValue>", ""));
    EXPECT_FALSE(SupportsRelTimeSeek(noRel.doc));
    // No Seek action.
    Doc noSeek(Replace(avt, "<name>Seek</name>", "<name>Seek2</name>"));
    EXPECT_FALSE(SupportsRelTimeSeek(noSeek.doc));
    // REL_TIME allowed for another variable only.
    Doc otherVar(Replace(avt, "<name>A_ARG_TYPE_SeekMode</name>", "<name>A_ARG_TYPE_Other</name>"));
    EXPECT_FALSE(SupportsRelTimeSeek(otherVar.doc));
    // Prefixed element names are not recognised.
    Doc prefixed("<s:scpd xmlns:s=\"urn:schemas-upnp-org:service-1-0\"><s:actionList><s:action>"
                 "<s:name>Seek</s:name></s:action></s:actionList><s:serviceStateTable>"
                 "<s:stateVariable><s:name>A_ARG_TYPE_SeekMode</s:name><s:allowedValueList>"
                 "<s:allowedValue>REL_TIME</s:allowedValue></s:allowedValueList></s:stateVariable>"
                 "</s:serviceStateTable></s:scpd>");
    EXPECT_FALSE(SupportsRelTimeSeek(prefixed.doc));

    std::string rcs = Fixture("gmediarender_renderingcontrol_scpd.xml");
    std::string noSet = rcs;
    size_t pos;
    while ((pos = noSet.find("<name>SetVolume</name>")) != std::string::npos)
        noSet.replace(pos, 22, "<name>SetVolumeX</name>");
    Doc noSetDoc(noSet);
    EXPECT_FALSE(SupportsSetVolume(noSetDoc.doc));
}

TEST(UpnpCapability, LimitedModelNeedsNoProbe)
{
    std::string desc = Fixture("gmediarender_description.xml");
    Doc limited(Replace(desc, "<modelName>gmediarender</modelName>",
                        "<modelName>WD TV HD Live</modelName>"));
    Doc near(Replace(desc, "<modelName>gmediarender</modelName>",
                     "<modelName>WD TV HD Live </modelName>"));
    RENDERER_INFO r;
    r.can_seek = r.can_set_volume = true;
    EXPECT_TRUE(IsLimitedModel(limited.doc, &r));
    EXPECT_FALSE(r.can_seek);
    EXPECT_FALSE(r.can_set_volume);
    RENDERER_INFO other;
    other.can_seek = true;
    EXPECT_FALSE(IsLimitedModel(near.doc, &other));
    EXPECT_TRUE(other.can_seek);
    EXPECT_FALSE(IsLimitedModel(nullptr, &r));
    EXPECT_FALSE(IsLimitedModel(limited.doc, nullptr));
}

class UpnpProbe : public ::testing::Test {
protected:
    void SetUp() override
    {
        ASSERT_GT(device.Start("127.0.0.1", 0), 0);
        base = device.BaseUrl();
        renderer.rcs_scpd_url = base + "/rcs.xml";
        renderer.avt_scpd_url = base + "/avt.xml";
        fakedev::Route rcs, avt;
        rcs.body = Fixture("gmediarender_renderingcontrol_scpd.xml");
        avt.body = Fixture("gmediarender_avtransport_scpd.xml");
        device.SetRoute("/rcs.xml", rcs);
        device.SetRoute("/avt.xml", avt);
    }
    fakedev::FakeHttpServer device;
    std::string base;
    RENDERER_INFO renderer;
    Doc description{Fixture("gmediarender_description.xml")};
};

TEST_F(UpnpProbe, BothDescriptionsDownloaded)
{
    ASSERT_EQ(0, GetRendererCapability(description.doc, &renderer));
    EXPECT_TRUE(renderer.can_seek);
    EXPECT_TRUE(renderer.can_set_volume);
    EXPECT_EQ(1u, device.RequestsOf("GET", "/rcs.xml").size());
    EXPECT_EQ(1u, device.RequestsOf("GET", "/avt.xml").size());
}

TEST_F(UpnpProbe, LimitedModelDownloadsNothing)
{
    Doc limited(Replace(Fixture("gmediarender_description.xml"),
                        "<modelName>gmediarender</modelName>", "<modelName>WD TV HD Live</modelName>"));
    renderer.can_seek = true;
    ASSERT_EQ(0, GetRendererCapability(limited.doc, &renderer));
    EXPECT_FALSE(renderer.can_seek);
    EXPECT_FALSE(renderer.can_set_volume);
    EXPECT_TRUE(device.Requests().empty());
}

TEST_F(UpnpProbe, UnreachableRenderingControlStopsTheProbe)
{
    renderer.rcs_scpd_url = base + "/missing.xml";  // 404
    EXPECT_EQ(-1, GetRendererCapability(description.doc, &renderer));
    EXPECT_FALSE(renderer.can_seek);
    EXPECT_FALSE(renderer.can_set_volume);
    EXPECT_TRUE(device.RequestsOf("GET", "/avt.xml").empty());

    renderer.rcs_scpd_url = "http://127.0.0.1:1/rcs.xml";  // refused
    EXPECT_EQ(-1, GetRendererCapability(description.doc, &renderer));
    renderer.rcs_scpd_url = "";
    EXPECT_EQ(-1, GetRendererCapability(description.doc, &renderer));
    EXPECT_EQ(-1, GetRendererCapability(nullptr, &renderer));
    EXPECT_EQ(-1, GetRendererCapability(description.doc, nullptr));
}

TEST_F(UpnpProbe, FailedTransportDescriptionLeavesBothFalse)
{
    fakedev::Route broken;
    broken.body = "<scpd><actionList><action><name>Seek</name>";
    device.SetRoute("/avt.xml", broken);
    EXPECT_EQ(-1, GetRendererCapability(description.doc, &renderer));
    EXPECT_FALSE(renderer.can_seek);
    EXPECT_FALSE(renderer.can_set_volume);
}

// Hostile answers: each download fails within its bounds, none crashes.
TEST_F(UpnpProbe, HostileAnswersFailInBoundedTime)
{
    std::string deep;
    for (int i = 0; i < 30000; ++i)
        deep += "<a>";
    for (int i = 0; i < 30000; ++i)
        deep += "</a>";
    struct Case {
        const char *name;
        fakedev::Mode mode;
        std::string body;
    } cases[] = {
        {"stall", fakedev::Mode::Stall, Fixture("gmediarender_avtransport_scpd.xml")},
        {"endless", fakedev::Mode::Endless, "<scpd>"},
        {"huge", fakedev::Mode::Huge, "<scpd>"},
        {"close", fakedev::Mode::Close, ""},
        {"garbage", fakedev::Mode::Garbage, "<scpd/>"},
        {"deep", fakedev::Mode::Normal, deep},
        {"binary", fakedev::Mode::Normal, std::string("\0\1\2<\xff>", 6)},
    };
    for (const Case &k : cases) {
        fakedev::Route route;
        route.mode = k.mode;
        route.body = k.body;
        device.SetRoute("/hostile.xml", route);
        IXML_Document *doc = nullptr;
        auto start = std::chrono::steady_clock::now();
        int rc = XmlDownloadDoc((base + "/hostile.xml").c_str(), &doc);
        double seconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
        EXPECT_NE(UPNP_E_SUCCESS, rc) << k.name;
        EXPECT_EQ(nullptr, doc) << k.name;
        EXPECT_LT(seconds, 20.0) << k.name;
        if (doc != nullptr)
            ixmlDocument_free(doc);
    }
    // The well-behaved route still works afterwards.
    IXML_Document *doc = nullptr;
    ASSERT_EQ(UPNP_E_SUCCESS, XmlDownloadDoc((base + "/rcs.xml").c_str(), &doc));
    ASSERT_NE(nullptr, doc);
    ixmlDocument_free(doc);
}

TEST_F(UpnpProbe, ShutdownCancelsARunningDownload)
{
    fakedev::Route stall;
    stall.mode = fakedev::Mode::Stall;
    stall.body = Fixture("gmediarender_avtransport_scpd.xml");
    device.SetRoute("/stall.xml", stall);
    int rc = 0;
    double seconds = 0;
    std::thread downloader([&] {
        IXML_Document *doc = nullptr;
        auto start = std::chrono::steady_clock::now();
        rc = XmlDownloadDoc((base + "/stall.xml").c_str(), &doc);
        seconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
        if (doc != nullptr)
            ixmlDocument_free(doc);
    });
    ASSERT_TRUE(device.WaitFor("GET", "/stall.xml", 1, 5000));
    XmlAbortDownloads(true);
    downloader.join();
    XmlAbortDownloads(false);
    EXPECT_EQ(UPNP_E_CANCELED, rc);
    EXPECT_LT(seconds, 5.0);  // the download alone would wait 10 s
    // Downloads work again afterwards.
    IXML_Document *doc = nullptr;
    EXPECT_EQ(UPNP_E_SUCCESS, XmlDownloadDoc((base + "/rcs.xml").c_str(), &doc));
    if (doc != nullptr)
        ixmlDocument_free(doc);
}

}  // namespace
