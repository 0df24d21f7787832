// Message texts with their arguments.

#include <gtest/gtest.h>

#include "platform/testing/Fakes.h"

namespace tessel {
namespace {

struct Thing {
  std::string description() const { return "a/b"; }
};

TEST(LogTest, FillsEveryConversionInOrder) {
  testing::RecordingLog log;
  tesselReporterLog().debug("%@:\t%llu %ld %u %.2f %f%s\n", Thing{},
                            uint64_t{18446744073709551615u}, int64_t{-3}, uint32_t{10}, 1.005,
                            125000.0, " (x)");
  tesselReporterLog().error("%@ and %@", SharedString("text %s"), SharedString());
  EXPECT_EQ(log.lines(),
            (std::vector<std::string>{"a/b:\t18446744073709551615 -3 10 1.00 125000.000000 (x)\n",
                                      "text %s and (null)"}));
  EXPECT_EQ(log.errors().size(), 1u);
}

TEST(LogTest, AtTheErrorLevelOnlyWarningsAreFormatted) {
  struct Counting {
    int* asked;
    std::string description() const { return std::to_string(++*asked); }
  };
  int asked = 0;
  testing::RecordingLog log(LogLevel::error);
  tesselReporterLog().debug("%@", Counting{&asked});
  EXPECT_EQ(asked, 0);
  platformLog().warning("%@ is lost", Thing{});
  EXPECT_EQ(log.lines(), std::vector<std::string>{"a/b is lost"});
}

}  // namespace
}  // namespace tessel
