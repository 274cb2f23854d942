#include "Daemon/support/QRNDaemonContext.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <memory>
#include <thread>
#include <vector>

namespace quarn {
namespace {

struct Counter {
    explicit Counter(QRNDaemonContext& context) : root(context.rootPrefix()) { ++made; }
    std::filesystem::path root;
    static inline int made = 0;
};

TEST(QRNDaemonContextTest, MakesEachInstanceOncePerContextUnlessReplacedAndFollowsSetCurrent) {
    Counter::made = 0;
    QRNDaemonContext first("/a"), second("/b");
    std::vector<Counter*> seen(8);
    std::vector<std::jthread> threads;
    for (std::size_t i = 0; i < seen.size(); ++i)
        threads.emplace_back([&, i] { seen[i] = &first.instance<Counter>(); });
    threads.clear(); // joins
    EXPECT_EQ(std::count(seen.begin(), seen.end(), &first.instance<Counter>()), 8);
    EXPECT_EQ(first.instance<Counter>().root, "/a");
    EXPECT_EQ(second.instance<Counter>().root, "/b");
    EXPECT_EQ(Counter::made, 2);

    // Install after first use replaces the instance: tests put fault-injecting
    // pieces in place of ones already used.
    EXPECT_FALSE(second.has<std::string>());
    EXPECT_EQ(second.instance<std::string>(), "");
    second.install(std::make_shared<std::string>("knob"));
    EXPECT_EQ(second.instance<std::string>(), "knob");
    EXPECT_EQ(*second.sharedInstance<std::string>(), "knob");

    // The current context follows setCurrent, and a default one is made when none is set.
    auto shared = std::make_shared<QRNDaemonContext>("/first");
    QRNDaemonContext::setCurrent(shared);
    EXPECT_EQ(&QRNDaemonContext::current(), shared.get());
    QRNDaemonContext::setCurrent(std::make_shared<QRNDaemonContext>("/second"));
    EXPECT_EQ(QRNDaemonContext::current().rootPrefix(), "/second");
    QRNDaemonContext::setCurrent(nullptr);
    EXPECT_FALSE(QRNDaemonContext::hasCurrent());
    EXPECT_EQ(QRNDaemonContext::current().rootPrefix(), "/");
    EXPECT_TRUE(QRNDaemonContext::hasCurrent());
}

} // namespace
} // namespace quarn
