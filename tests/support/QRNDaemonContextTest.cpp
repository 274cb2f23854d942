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

TEST(QRNDaemonContextTest, MakesEachInstanceOncePerContext) {
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
}

TEST(QRNDaemonContextTest, InstallAfterFirstUseReplacesTheInstance) {
    // Tests put fault-injecting pieces in place of ones already used.
    struct Knob {
        int value = 1;
    };
    QRNDaemonContext context;
    EXPECT_FALSE(context.has<Knob>());
    EXPECT_EQ(context.instance<Knob>().value, 1);
    context.install(std::make_shared<Knob>(2));
    EXPECT_EQ(context.instance<Knob>().value, 2);
    EXPECT_EQ(context.sharedInstance<Knob>()->value, 2);
}

TEST(QRNDaemonContextTest, CurrentFollowsSetCurrent) {
    auto first = std::make_shared<QRNDaemonContext>("/first");
    QRNDaemonContext::setCurrent(first);
    EXPECT_EQ(&QRNDaemonContext::current(), first.get());
    QRNDaemonContext::setCurrent(std::make_shared<QRNDaemonContext>("/second"));
    EXPECT_EQ(QRNDaemonContext::current().rootPrefix(), "/second");
    QRNDaemonContext::setCurrent(nullptr);
    EXPECT_FALSE(QRNDaemonContext::hasCurrent());
    EXPECT_EQ(QRNDaemonContext::current().rootPrefix(), "/");
    EXPECT_TRUE(QRNDaemonContext::hasCurrent());
}

} // namespace
} // namespace quarn
