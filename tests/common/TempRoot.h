#pragma once
// The throw-away root of one test (see ScratchRoot), and a fixture that
// makes one per test.

#include "common/shared/ScratchRoot.h"

#include <gtest/gtest.h>

namespace quarn::test {

using TempRoot = ScratchRoot;

// Fixture base: a TempRoot per test.
class TempRootTest : public ::testing::Test {
protected:
    TempRoot root_;
};

} // namespace quarn::test
