// Membership and attributes of trace objects.

#include "objects/TesselObject.h"

namespace tessel {

bool TesselSupportObject::isKindOf(TesselClass wanted) const {
  if (class_ == wanted) return true;
  switch (wanted) {
    case TesselClass::supportObject:
      return true;
    case TesselClass::object:
      return class_ != TesselClass::supportObject;
    case TesselClass::interval:
      return class_ == TesselClass::animationInterval;
    case TesselClass::event:
    case TesselClass::animationInterval:
      return false;
  }
  return false;
}

StringRef TesselInterval::attribute(std::string_view key) const {
  for (const auto& [name, value] : interval_.attributes) {
    if (sameString(name, key)) return value;
  }
  return {};
}

}  // namespace tessel
