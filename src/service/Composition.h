// Composition: makes every part of the service and joins them.
//
// main.cpp gives it the real outside. A test gives it one of its own, and then runs the same
// service: its parts, their threads and their order.

#pragma once

#include "linux/LaunchConfiguration.h"
#include "linux/Scheduler.h"
#include "linux/ServiceRuntime.h"
#include "linux/StateDirectory.h"
#include "platform/Analytics.h"
#include "platform/System.h"
#include "platform/Threads.h"

namespace tessel {

// What the service meets outside of itself. All of it lives as long as the process.
struct Outside {
  Clock& clock;
  Threads& threads;
  ServiceManager& manager;
  const StateDirectory& state;
  FileManager& files;  // where the run marker is
  ConfigurationService& configurations;
  const DeferralConditions& conditions;
};

// Makes every part, and registers the activity: the check-in and the runs then come on a thread of
// the scheduler. The caller enters the main loop of the answer. No part is ever destroyed, because
// the process may end at any moment and on any thread, and no other thread must then use a part
// that is half destroyed.
ServiceRuntime& startService(const LaunchConfiguration& launch, const Outside& outside);

}  // namespace tessel
