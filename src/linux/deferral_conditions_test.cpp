// When the defer file, the battery and the pressure on the CPU speak against a run.

#include <gtest/gtest.h>

#include <filesystem>

#include "linux/Scheduler.h"
#include "os/testing/TemporaryDirectory.h"

namespace tessel {
namespace {

using testing::TemporaryDirectory;

class DeferralConditionsTest : public ::testing::Test {
 protected:
  bool defers(DeferSources sources) const {
    const DeferralConditions conditions(sources, machine_.path("defer"), machine_.path("power"),
                                        machine_.path("cpu"));
    return conditions.byFile() != DeferReason::none || conditions.byMachine() != DeferReason::none;
  }
  bool battery() const { return defers({false, true, false}); }
  bool pressure() const { return defers({false, false, true}); }

  struct Supply {
    const char* type = "Battery";
    const char* status = "Discharging";
    const char* capacity = "19";
  };
  void plug(const std::string& name, const Supply& supply) const {
    const std::string directory = "power/" + name + "/";
    machine_.write(directory + "type", std::string(supply.type) + "\n");
    machine_.write(directory + "status", std::string(supply.status) + "\n");
    machine_.write(directory + "capacity", std::string(supply.capacity) + "\n");
  }

  TemporaryDirectory machine_;
};

TEST_F(DeferralConditionsTest, AMissingSourceNeverDefers) {
  EXPECT_FALSE(defers({true, true, true}));
}

TEST_F(DeferralConditionsTest, ADisabledSourceNeverDefers) {
  machine_.write("defer", "");
  plug("BAT0", {});
  machine_.write("cpu", "some avg10=99.00 avg60=0.00 avg300=0.00 total=1\n");
  EXPECT_FALSE(defers({false, false, false}));
  EXPECT_TRUE(defers({true, false, false}));
  EXPECT_TRUE(battery());
  EXPECT_TRUE(pressure());
}

TEST_F(DeferralConditionsTest, ALinkToNowhereIsADeferFile) {
  std::filesystem::create_symlink("/nowhere", machine_.path("defer"));
  EXPECT_TRUE(defers({true, false, false}));
}

TEST_F(DeferralConditionsTest, ALowDrainingBatteryDefers) {
  const struct {
    Supply supply;
    bool defers;
  } kCases[] = {
      {{"Battery", "Discharging", "19"}, true},  {{"Battery", "Discharging", "0"}, true},
      {{"Battery", "Discharging", "20"}, false}, {{"Battery", "Charging", "5"}, false},
      {{"Battery", "Not charging", "5"}, false}, {{"Battery", "Unknown", "5"}, false},
      {{"Battery", "Discharging", ""}, false},   {{"Battery", "Discharging", "1x"}, false},
      {{"Mains", "Discharging", "5"}, false},
  };
  for (const auto& [supply, expected] : kCases) {
    plug("BAT0", supply);
    EXPECT_EQ(battery(), expected) << supply.type << " " << supply.status << " " << supply.capacity;
  }
}

TEST_F(DeferralConditionsTest, AllOwnBatteriesMustBeLow) {
  plug("BAT0", {"Battery", "Discharging", "10"});
  machine_.write("power/BAT1/present", "0\n");
  plug("BAT1", {"Battery", "Unknown", "90"});
  machine_.write("power/hid-mouse/scope", "Device\n");
  plug("hid-mouse", {"Battery", "Discharging", "90"});
  EXPECT_TRUE(battery());
  machine_.write("power/BAT1/present", "1\n");
  EXPECT_FALSE(battery()) << "the second battery is full";
  plug("BAT0", {"Battery", "Charging", "90"});
  plug("BAT1", {"Battery", "Charging", "90"});
  plug("hid-mouse", {"Battery", "Discharging", "1"});
  EXPECT_FALSE(battery()) << "only the mouse is low";
}

TEST_F(DeferralConditionsTest, PressureAboveEightyDefers) {
  const struct {
    const char* text;
    bool defers;
  } kCases[] = {
      {"some avg10=80.01 avg60=0.00 avg300=0.00 total=1\nfull avg10=0.00 avg60=0.00\n", true},
      {"some avg10=80.00 avg60=99.00 avg300=99.00 total=1\nfull avg10=99.00 avg60=0.00\n", false},
      {"full avg10=99.00 avg60=0.00\nsome avg10=1.00 avg60=99.00 avg300=0.00 total=1\n", false},
      {"full avg10=0.00 avg60=0.00\nsome avg10=81.00 avg60=0.00 avg300=0.00 total=1\n", true},
      {"some avg10=100.00", true},
      {"some avg10=\n", false},
      {"some avg10=many avg60=99.00\n", false},
      {"awesome avg10=99.00\n", false},
      {"", false},
  };
  for (const auto& [text, expected] : kCases) {
    machine_.write("cpu", text);
    EXPECT_EQ(pressure(), expected) << text;
  }
}

}  // namespace
}  // namespace tessel
