#include "support/test_seed.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <iostream>
#include <random>
#include <string>

namespace tavix::testing {

std::uint32_t testSeed() {
  const char* given = std::getenv("TAVIX_TEST_SEED");
  const std::uint32_t seed = given ? static_cast<std::uint32_t>(std::strtoul(given, nullptr, 10)) : std::random_device{}();
  std::cout << "seed " << seed << " (replay with TAVIX_TEST_SEED=" << seed << ")" << std::endl;
  ::testing::Test::RecordProperty("seed", std::to_string(seed));
  return seed;
}

}  // namespace tavix::testing
