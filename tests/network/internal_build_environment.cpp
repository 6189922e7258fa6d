// This binary runs as an internal build: the developer settings suite is in force.
#include "network_test_environment.h"

namespace {
[[maybe_unused]] ::testing::Environment* const kEnvironment =
    ::testing::AddGlobalTestEnvironment(new nettest::NetworkEnvironment(/*internalBuild=*/true));
}  // namespace
