// This binary runs as a production device: the developer settings suite must be ignored.
#include "network_test_environment.h"

namespace {
[[maybe_unused]] ::testing::Environment* const kEnvironment =
    ::testing::AddGlobalTestEnvironment(new nettest::NetworkEnvironment(/*internalBuild=*/false));
}  // namespace
