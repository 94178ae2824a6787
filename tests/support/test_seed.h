// The seed of a randomised test: TAVIX_TEST_SEED when set (to replay a failure), else a fresh
// one. Printed, and recorded as the running test's property "seed". For GoogleTest tests only.
#pragma once

#include <cstdint>

namespace tavix::testing {

std::uint32_t testSeed();

}  // namespace tavix::testing
