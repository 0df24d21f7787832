// Rules and sets of the string whitelist.

#include "whitelist/StringWhitelist.h"

#include "platform/Log.h"
#include "whitelist/WhitelistLists.h"

namespace tessel {

namespace {

// The set is never destroyed: a run may still ask while the process exits.
const StringSet& makeWhitelist(LogFormat<size_t> message, std::initializer_list<StringList> lists) {
  const auto* set = new StringSet(lists);
  tesselReporterLog().debug(message, set->size());
  return *set;
}

const StringSet& quarroWhitelist() {
  static const StringSet& set =
      makeWhitelist("Using string whitelist with %lu elements for Quarro platform",
                    {perfLoggingComponentNames(), perfLoggingActionNames(),
                     desktopBundleIdentifiers(), fileSystemScanValues(), commonWhitelistValues()});
  return set;
}

const StringSet& selvinWhitelist() {
  static const StringSet& set =
      makeWhitelist("Using string whitelist with %lu elements for Selvin platform",
                    {launchSourceValues(), cameraValues(), shareActivityTypes(),
                     extensionBundleIdentifiers(), periodViewValues(), sizeValues(),
                     mailAccountKindValues(), generationSourceValues(), commonWhitelistValues()});
  return set;
}

const StringSet& darrowWhitelist() {
  static const StringSet& set = makeWhitelist(
      "Using string whitelist with %lu elements for Darrow platform", {commonWhitelistValues()});
  return set;
}

const StringSet& fennicWhitelist() {
  static const StringSet& set = makeWhitelist(
      "Using string whitelist with %lu elements for Fennic platform", {commonWhitelistValues()});
  return set;
}

const StringSet& lumetWhitelist() {
  static const StringSet& set =
      makeWhitelist("Using string whitelist with %lu elements for Lumet platform", {});
  return set;
}

const StringSet& unknownPlatformWhitelist() {
  static const StringSet& set =
      makeWhitelist("Using string whitelist with %lu elements for Unknown platform", {});
  return set;
}

}  // namespace

bool shouldUseStringWhitelist(BuildVariant& variant) {
  if (variant.hasInternalDiagnostics("com.vantor.tessel")) {
    tesselReporterLog().debug("Not using string whitelist due to os_flavor");
    return false;
  }
  tesselReporterLog().debug("Defaulting to using string whitelist");
  return true;
}

bool isPerfLoggingOperation(StringRef subsystem, StringRef category, StringRef name) {
  return sameString(subsystem, "com.vantor.PerformanceAnalysis") &&
         sameString(category, "PerfLogging") && sameString(name, "PerfLoggingOperation");
}

bool perfLoggingOperationStringsPass(StringRef component, StringRef action) {
  if (!component.present() || !action.present()) return false;
  return perfLoggingComponentSet().contains(component) && perfLoggingActionSet().contains(action);
}

const StringSet& perfLoggingComponentSet() {
  static const StringSet& set = *new StringSet({perfLoggingComponentNames()});
  return set;
}

const StringSet& perfLoggingActionSet() {
  static const StringSet& set = *new StringSet({perfLoggingActionNames()});
  return set;
}

const StringSet& stringWhitelistForPlatform(TesselReporterPlatform platform) {
  switch (platform) {
    case TesselReporterPlatform::quarro:
      return quarroWhitelist();
    case TesselReporterPlatform::selvin:
      return selvinWhitelist();
    case TesselReporterPlatform::darrow:
      return darrowWhitelist();
    case TesselReporterPlatform::fennic:
      return fennicWhitelist();
    case TesselReporterPlatform::lumet: {
      const StringSet& set = lumetWhitelist();
      tesselReporterLog().debug("Using string whitelist with %lu elements", set.size());
      return set;
    }
    case TesselReporterPlatform::unknown:
      break;
  }
  return unknownPlatformWhitelist();
}

bool stringIsWhitelisted(StringRef value, TesselReporterPlatform platform) {
  return stringWhitelistForPlatform(platform).contains(value);
}

}  // namespace tessel
