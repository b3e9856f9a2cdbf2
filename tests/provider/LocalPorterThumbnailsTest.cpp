#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>

#include "platform/device/DeviceAnswer.h"
#include "platform/imaging/IconBitmap.h"
#include "platform/imaging/ImageEncoder.h"
#include "platform/objects/Number.h"
#include "tests/provider/ProviderOperationsTest.h"

namespace tamber {

// Defined with the thumbnails.
using IconVariantSource = std::function<std::optional<Bytes>(const AppRecord&, int variant)>;
void ResetThumbnailDeviceTraitsForTesting();
void SetIconVariantSourceForTesting(IconVariantSource source);

namespace {

using namespace testing;

struct Thumbnail {
    HostPorterItemIdentifier identifier;
    std::optional<Bytes> png;
    std::string type;
};

class LocalPorterThumbnailsTest : public ProviderOperationsTest {
protected:
    void TearDown() override {
        SetIconVariantSourceForTesting(nullptr);
        ClearDeviceAnswerOverrides();
        ResetThumbnailDeviceTraitsForTesting();
        ProviderOperationsTest::TearDown();
    }

    void setDevice(int64_t deviceClass, float scale) {
        SetDeviceAnswerOverride("DeviceClassNumber", Number::fromInt64(deviceClass));
        SetDeviceAnswerOverride("main-screen-scale", Number::fromDouble(scale));
        ResetThumbnailDeviceTraitsForTesting();
    }

    // Records the variants asked for; answers data only for `answered`.
    std::vector<int> variantsAskedFor(std::optional<int> answered = std::nullopt,
                                      std::optional<Bytes>* result = nullptr) {
        std::vector<int> asked;
        SetIconVariantSourceForTesting([&](const AppRecord&, int variant) -> std::optional<Bytes> {
            asked.push_back(variant);
            if (answered == variant)
                return Bytes{uint8_t(variant)};
            return std::nullopt;
        });
        auto record = app(kApp);
        auto data = porter->bestIconData(*record);
        SetIconVariantSourceForTesting(nullptr);
        if (result)
            *result = data;
        else
            EXPECT_FALSE(data);
        return asked;
    }

    // A registered application whose icon is `name` in the user's hicolor theme.
    void installWithIcon(const std::string& bundle, const std::string& iconName) {
        auto plain = app(bundle);
        auto fields = plain->fields();
        fields.iconName = iconName;
        registry->replace(
            AppRegistry::kUserApplications,
            {app(kApp), AppRecord::make(fields, {false, false, plain->infoDictionary()})});
    }
    std::string iconPath(const std::string& name, int side) {
        std::string folder =
            dir / ("icons/hicolor/" + std::to_string(side) + "x" + std::to_string(side) + "/apps");
        std::filesystem::create_directories(folder);
        return folder + "/" + name + ".png";
    }
    void writePNGIcon(const std::string& name, uint32_t side) {
        Bytes pixels(side * side * 4, 0x7f);
        auto buffer = std::make_shared<Bytes>();
        auto encoder = ImageEncoder::create(buffer, ImageEncoder::kPNGType, 1);
        ASSERT_TRUE(encoder);
        encoder->addImage(Image::make(side, side, pixels));
        ASSERT_TRUE(encoder->finalize());
        std::ofstream(iconPath(name, side), std::ios::binary)
            .write(reinterpret_cast<const char*>(buffer->data()), buffer->size());
    }

    std::vector<Thumbnail> fetch(const std::vector<HostPorterItemIdentifier>& identifiers,
                                 bool typed = false) {
        std::vector<Thumbnail> thumbnails;
        int completions = 0;
        size_t seenAtCompletion = 0;
        auto done = [&](Status status) {
            EXPECT_TRUE(status.ok());
            ++completions;
            seenAtCompletion = thumbnails.size();
        };
        if (typed) {
            porter->fetchThumbnailsForItemIdentifiers(
                identifiers, {64, 64},
                LocalPorter::PerThumbnailCompletionWithType(
                    [&](const HostPorterItemIdentifier& id, std::optional<Bytes> png,
                        const std::string& type, std::optional<Error> error) {
                        EXPECT_FALSE(error);
                        thumbnails.push_back({id, std::move(png), type});
                    }),
                done);
        } else {
            porter->fetchThumbnailsForItemIdentifiers(
                identifiers, {64, 64},
                LocalPorter::PerThumbnailCompletion([&](const HostPorterItemIdentifier& id,
                                                        std::optional<Bytes> png,
                                                        std::optional<Error> error) {
                    EXPECT_FALSE(error);
                    thumbnails.push_back({id, std::move(png), ""});
                }),
                done);
        }
        EXPECT_EQ(completions, 1);
        EXPECT_EQ(seenAtCompletion, identifiers.size()) << "completion before every thumbnail";
        return thumbnails;
    }
};

TEST_F(LocalPorterThumbnailsTest, VariantsFollowTheScaleDownToABoundedRetryAtOne) {
    setDevice(kDeviceClassHandset, 3.0f);
    EXPECT_EQ(variantsAskedFor(), (std::vector<int>{32, 15, 0, 0, 0}));

    setDevice(kDeviceClassTablet, 2.0f);
    EXPECT_EQ(variantsAskedFor(), (std::vector<int>{24, 1, 1, 1}));

    setDevice(kDeviceClassComputer, 2.0f);
    EXPECT_EQ(variantsAskedFor(), (std::vector<int>{15, 0, 0, 0}));

    // Any other scale uses the device class as the variant, and 0.5 is below any icon.
    setDevice(kDeviceClassTablet, 2.5f);
    EXPECT_EQ(variantsAskedFor(), (std::vector<int>{1, 1}));
    setDevice(kDeviceClassComputer, 2.5f);
    EXPECT_EQ(variantsAskedFor(), (std::vector<int>{0, 0}));

    setDevice(kDeviceClassComputer, 0.5f);
    EXPECT_TRUE(variantsAskedFor().empty());
}

TEST_F(LocalPorterThumbnailsTest, FirstVariantWithDataWins) {
    setDevice(kDeviceClassHandset, 3.0f);
    std::optional<Bytes> data;
    EXPECT_EQ(variantsAskedFor(15, &data), (std::vector<int>{32, 15}));
    EXPECT_EQ(data, Bytes{15});
    // A late icon at scale 1.0 is still found within the retries.
    setDevice(kDeviceClassComputer, 1.0f);
    std::vector<int> asked;
    SetIconVariantSourceForTesting([&](const AppRecord&, int variant) -> std::optional<Bytes> {
        asked.push_back(variant);
        return asked.size() == 2 ? std::optional<Bytes>(Bytes{7}) : std::nullopt;
    });
    EXPECT_EQ(porter->bestIconData(*app(kApp)), Bytes{7});
    EXPECT_EQ(asked, (std::vector<int>{0, 0}));
}

TEST_F(LocalPorterThumbnailsTest, DeviceIsAskedOncePerProcess) {
    setDevice(kDeviceClassHandset, 3.0f);
    EXPECT_EQ(variantsAskedFor().front(), 32);
    // A later answer is not seen until the cached pair is dropped.
    SetDeviceAnswerOverride("main-screen-scale", Number::fromDouble(2.0));
    SetDeviceAnswerOverride("DeviceClassNumber", Number::fromInt64(kDeviceClassTablet));
    EXPECT_EQ(variantsAskedFor().front(), 32);
    ResetThumbnailDeviceTraitsForTesting();
    EXPECT_EQ(variantsAskedFor().front(), 24);
}

TEST_F(LocalPorterThumbnailsTest, AppLibraryGetsItsIconAsPNGAndFilesGetNothing) {
    setDevice(kDeviceClassComputer, 1.0f);
    writePNGIcon("tamber-test-icon", 48);
    installWithIcon("com.example.icon", "tamber-test-icon");
    log->clear();

    auto thumbnails = fetch({"fid=12", "#com.example.icon", "did=3"});
    ASSERT_EQ(thumbnails.size(), 3u);
    EXPECT_EQ(thumbnails[0].identifier, "fid=12");
    EXPECT_EQ(thumbnails[1].identifier, "#com.example.icon");
    EXPECT_EQ(thumbnails[2].identifier, "did=3");
    EXPECT_FALSE(thumbnails[0].png);
    EXPECT_FALSE(thumbnails[2].png);
    ASSERT_TRUE(thumbnails[1].png);
    auto decoded = CreateIconFromCachedBitmap(*thumbnails[1].png);
    ASSERT_TRUE(decoded);
    EXPECT_EQ(decoded->width(), 48u);
    EXPECT_EQ(decoded->pixels()[0], 0x7f);

    // One section, and a line for the library only: files are not this extension's to draw.
    std::vector<std::string> lines;
    for (const auto& text : log->texts())
        if (text.find("\u250f") == std::string::npos && text.find("\u2517") == std::string::npos)
            lines.push_back(text);
    EXPECT_EQ(lines,
              std::vector<std::string>{"[DEBUG] #com.example.icon: returning " +
                                       std::to_string(thumbnails[1].png->size()) + " bytes"});
    EXPECT_EQ(sectionsTitled("fetching thumbnails for [fid=12, #com.example.icon, did=3]"), 1u);
}

TEST_F(LocalPorterThumbnailsTest, TypedHandlerReportsPNGForEverySlot) {
    setDevice(kDeviceClassComputer, 1.0f);
    writePNGIcon("tamber-test-icon", 32);
    installWithIcon("com.example.icon", "tamber-test-icon");
    auto thumbnails = fetch({"#com.example.icon", "did=9"}, true);
    ASSERT_EQ(thumbnails.size(), 2u);
    EXPECT_TRUE(thumbnails[0].png);
    EXPECT_FALSE(thumbnails[1].png);
    EXPECT_EQ(thumbnails[0].type, "public.png");
    EXPECT_EQ(thumbnails[1].type, "public.png");
}

TEST_F(LocalPorterThumbnailsTest, EachFailingStepLogsOneLineAndTheOthersStillComplete) {
    setDevice(kDeviceClassComputer, 1.0f);
    // An app without an icon (the fixture's), one not installed, one whose icon is not a PNG.
    installWithIcon("com.example.broken", "tamber-broken-icon");
    std::ofstream(iconPath("tamber-broken-icon", 48)) << "\x89PNG not really";
    writePNGIcon("tamber-test-icon", 48);
    log->clear();

    auto thumbnails = fetch({"#com.example.notes", "#com.example.gone", "#com.example.broken"});
    ASSERT_EQ(thumbnails.size(), 3u);
    for (const auto& thumbnail : thumbnails) EXPECT_FALSE(thumbnail.png) << thumbnail.identifier;
    EXPECT_EQ(log->count("[DEBUG] #com.example.notes: can't get primary icon data; the "
                         "application names no icon",
                         LogLevel::Debug),
              1u);
    EXPECT_EQ(log->count("[DEBUG] #com.example.gone: can't get app proxy for com.example.gone",
                         LogLevel::Debug),
              1u);
    EXPECT_EQ(log->count("[ERROR] #com.example.broken: can't create icon from cached bitmap",
                         LogLevel::Error),
              1u);
    EXPECT_EQ(log->countStartingWith("[ERROR]"), 1u);
}

}  // namespace
}  // namespace tamber
