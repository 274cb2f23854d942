#pragma once
// One daemon for the tests that check it keeps serving: under hostile
// frames, lock-state changes and many concurrent clients.

#include "SharedDaemonTest.h"

namespace quarn::test {

class Serving : public SharedDaemonTest {};

} // namespace quarn::test
