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

struct Base {
    virtual ~Base() = default;
    virtual int value() const = 0;
};
template <int N> struct Answer : Base {
    int value() const override { return N; }
};

TEST(QRNDaemonContextTest, MakesEachInstanceOncePerContext) {
    Counter::made = 0;
    QRNDaemonContext first("/a");
    QRNDaemonContext second("/b");
    std::vector<std::thread> threads;
    std::vector<Counter*> seen(8);
    for (std::size_t i = 0; i < seen.size(); ++i) {
        threads.emplace_back([&, i] { seen[i] = &first.instance<Counter>(); });
    }
    for (auto& thread : threads)
        thread.join();
    EXPECT_EQ(std::count(seen.begin(), seen.end(), seen.front()), 8);
    EXPECT_EQ(first.instance<Counter>().root, "/a");
    EXPECT_EQ(second.instance<Counter>().root, "/b");
    EXPECT_NE(&first.instance<Counter>(), &second.instance<Counter>());
    EXPECT_EQ(Counter::made, 2);
}

TEST(QRNDaemonContextTest, InstallAfterFirstUseReplacesTheInstance) {
    // Tests put fault-injecting pieces in place of ones already used.
    QRNDaemonContext context;
    EXPECT_FALSE(context.has<Base>());
    context.install<Base>(std::make_shared<Answer<1>>());
    EXPECT_EQ(context.instance<Base>().value(), 1);
    context.install<Base>(std::make_shared<Answer<2>>());
    EXPECT_EQ(context.instance<Base>().value(), 2);
    EXPECT_EQ(context.sharedInstance<Base>()->value(), 2);
}

TEST(QRNDaemonContextTest, CurrentFollowsSetCurrent) {
    auto first = std::make_shared<QRNDaemonContext>("/first");
    auto second = std::make_shared<QRNDaemonContext>("/second");
    QRNDaemonContext::setCurrent(first);
    EXPECT_EQ(QRNDaemonContext::current().rootPrefix(), "/first");
    QRNDaemonContext::setCurrent(second);
    EXPECT_EQ(&QRNDaemonContext::current(), second.get());
    QRNDaemonContext::setCurrent(nullptr);
    EXPECT_FALSE(QRNDaemonContext::hasCurrent());
    EXPECT_EQ(QRNDaemonContext::current().rootPrefix(), "/");
    EXPECT_TRUE(QRNDaemonContext::hasCurrent());
}

} // namespace
} // namespace quarn
