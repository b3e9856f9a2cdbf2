#include <gtest/gtest.h>

#include "host/HostExtensionMain.h"
#include "host/HostPorterManager.h"
#include "tests/common/ScopedLogCapture.h"

namespace tamber {
namespace {

TEST(HostPorterManagerDeathTest, UsingTheManagerBeforeOneIsInstalledStops) {
    auto previous = HostPorterManager::installDefaultManager(nullptr);
    EXPECT_DEATH(HostPorterManager::defaultManager(), "no HostPorterManager installed");
    HostPorterManager::installDefaultManager(previous);
}

class CountingExtension : public HostPorterExtension {};

TEST(HostExtensionMainTest, HandsThePrincipalInstanceToTheRuntimeOrFailsWith70) {
    testing::ScopedLogCapture log;
    HostRegisterPrincipalClass(nullptr);
    HostRegisterRuntime(nullptr);
    char arg0[] = "tamber";
    char* argv[] = {arg0, nullptr};
    EXPECT_EQ(HostExtensionMain(1, argv), 70);
    EXPECT_EQ(log->countStartingWith("[ERROR] no extension principal class"), 1u);

    int made = 0;
    HostRegisterPrincipalClass([&] {
        ++made;
        return std::make_shared<CountingExtension>();
    });
    std::shared_ptr<HostPorterExtension> received;
    HostRegisterRuntime([&](int argc, char**, std::shared_ptr<HostPorterExtension> ext) {
        received = ext;
        return argc + 40;
    });
    EXPECT_EQ(HostExtensionMain(1, argv), 41);
    EXPECT_EQ(made, 1);
    EXPECT_TRUE(std::dynamic_pointer_cast<CountingExtension>(received));
    HostRegisterPrincipalClass(nullptr);
    HostRegisterRuntime(nullptr);
}

}  // namespace
}  // namespace tamber
