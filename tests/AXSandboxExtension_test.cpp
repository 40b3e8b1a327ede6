#include <gtest/gtest.h>
#include <fcntl.h>
#include <unistd.h>

#include "Annexa/AXSandboxExtension.h"
#include "platform/sandbox/Sandbox.h"
#include "tests/support/TestSupport.h"

using annexa::AXSandboxExtension;

TEST(AXSandboxExtension, ConsumeOnceExpelOnceReleaseOnDestruction) {
    axtest::PlatformRoot root;
    auto broker = corvane::sandbox::Broker::start(corvane::dispatch::Queue::create("broker"));
    ASSERT_TRUE(broker) << broker.error().description();
    axtest::writeFile(root / "plugin.txt", "p");
    auto token = annexa::issueReadExtensionForURL(root / "plugin.txt");
    ASSERT_TRUE(token);

    int64_t kept;
    {
        AXSandboxExtension ext(*token);
        EXPECT_EQ(ext.handle(), 0);
        ext.expel();  // never consumed: nothing happens
        ext.consume();
        kept = ext.handle();
        ASSERT_GT(kept, 0);
        ext.consume();  // the facility is asked once
        EXPECT_EQ(ext.handle(), kept);
        ext.expel();
        EXPECT_EQ(ext.handle(), 0);
        EXPECT_EQ(fcntl(static_cast<int>(kept), F_GETFD), -1);
        ext.expel();
        ext.consume();
        kept = ext.handle();
        EXPECT_GE(fcntl(static_cast<int>(kept), F_GETFD), 0);
    }
    EXPECT_EQ(fcntl(static_cast<int>(kept), F_GETFD), -1);  // released by destruction

    errno = 0;
    EXPECT_FALSE(annexa::issueReadExtensionForURL(root / "absent"));
    EXPECT_EQ(errno, ENOENT);
    // A refused token is stored as the facility gives it (-1) and released without harm.
    AXSandboxExtension bad("not a token");
    bad.consume();
    EXPECT_EQ(bad.handle(), -1);
}
