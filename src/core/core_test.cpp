#include <gtest/gtest.h>

#include "core/assembly.h"
#include "core/diagnostics.h"
#include "core/logging.h"
#include "platform/counters.h"
#include "platform/defaults.h"
#include "support/temp_home.h"

namespace tavix {
namespace {

TEST(TavixLogging, CategoriesAreNamedInTheirFixedOrder) {
  EXPECT_STREQ(TavixLogCategoryName(0), "Tavix");
  EXPECT_STREQ(TavixLogCategoryName(12), "Tavix_Connection");
  EXPECT_STREQ(TavixLogCategoryName(17), "Tavix_Feedback_Errors");
  EXPECT_EQ(TavixLogForCategory(20).category(), "Tavix_UploadManager");
  EXPECT_EQ(&TavixLogForCategory(14), &TavixLogForCategory(TavixLoggingCategoryBag));
  EXPECT_EQ(TavixLogCategoryName(21), nullptr);
}

TEST(TavixLoggingDeathTest, CategoryOutOfRangeStopsWithTheAssertion) {
  EXPECT_DEATH(TavixLogForCategory(21), "category < TavixLoggingCategoryCount");
}

TEST(Diagnostics, CounterKeysAndTheReporterShareOneStore) {
  EXPECT_EQ(createCounterKey("seekara", "keystrokes"), "com.norvel.tavixd.seekara.keystrokes");
  const std::string key = createCounterKey("test", "diagnostics");
  TavixDiagnosticDataReporter::addValue(2, key);
  TavixDiagnosticDataReporter::addValue(3, key);
  EXPECT_EQ(TavixDiagnosticDataReporter::store().value(key), 5);
  TavixDiagnosticDataReporter::setValue(9, key);
  EXPECT_EQ(TavixDiagnosticDataReporter::store().value(key), 9);
  TavixDiagnosticDataReporter::clearScalarKey(key);
  EXPECT_EQ(TavixDiagnosticDataReporter::store().snapshot().count(key), 0u);
}

TEST(Assembly, UseMarvolaFollowsTheDefaultAtOnceAndDiskBagCacheIsAlwaysOn) {
  testing::TempHome home;
  Assembly assembly;
  assembly.userDefaults = std::make_shared<platform::UserDefaults>(home.config(), kTavixdDomain);
  assembly.userDefaults->registerDefaults({{"TVXUseMarvola", platform::PropertyValue(true)}});
  EXPECT_TRUE(assembly.useMarvola());
  assembly.userDefaults->setObject("TVXUseMarvola", platform::PropertyValue(false));
  EXPECT_FALSE(assembly.useMarvola());
  EXPECT_TRUE(assembly.diskBagCacheEnabled());
}

}  // namespace
}  // namespace tavix
