#include "Daemon/platform/SandboxKernel.h"

#include <gtest/gtest.h>

using namespace quarn;

namespace {
SandboxItem item(std::string id, std::uint64_t cls, std::string path) {
    return SandboxItem{1, std::move(id), cls, 501, std::move(path)};
}
std::vector<SandboxItem> itemsOf(const SandboxKernel& k, std::uint32_t uid) {
    std::vector<SandboxItem> out;
    k.forEachItem(uid, [&](const SandboxItem& i) {
        out.push_back(i);
        return true;
    });
    return out;
}
} // namespace

TEST(SandboxKernel, MappingsArePerUserAndReplaceByIdentity) {
    InMemorySandboxKernel k;
    EXPECT_EQ(k.setContainerMapping(501, item("com.a", 2, "/c/A")), 0);
    EXPECT_EQ(k.setContainerMapping(501, item("com.a", 2, "/c/B")), 0); // same container, new path
    EXPECT_EQ(k.setContainerMapping(501, item("com.a", 4, "/c/P")), 0);
    EXPECT_EQ(k.setContainerMapping(502, item("com.a", 2, "/d/A")), 0);
    auto items = itemsOf(k, 501);
    ASSERT_EQ(items.size(), 2u);
    EXPECT_EQ(items[0].path, "/c/B");
    EXPECT_EQ(k.count(502), 1u);
    EXPECT_EQ(k.count(503), 0u);

    EXPECT_EQ(k.removeContainerMapping(501, item("com.a", 2, "")), 0);
    EXPECT_EQ(k.removeContainerMapping(501, item("com.a", 2, "")), ENOENT);
    EXPECT_EQ(k.count(501), 1u);
    EXPECT_EQ(k.setContainerMapping(501, item("", 2, "/x")), EINVAL);
}

TEST(SandboxKernel, IterationStopsAndToleratesReentry) {
    InMemorySandboxKernel k;
    for (int i = 0; i < 5; ++i) {
        k.setContainerMapping(501, item("id" + std::to_string(i), 2, "/p"));
    }
    int seen = 0;
    k.forEachItem(501, [&](const SandboxItem& i) {
        ++seen;
        k.removeContainerMapping(501, i); // must not deadlock
        return seen < 3;
    });
    EXPECT_EQ(seen, 3);
    EXPECT_EQ(k.count(501), 2u);
}
