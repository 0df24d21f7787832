// Names of fields and reasons.

#include "trace/TracePointFields.h"

namespace tessel {

namespace {

struct NamedField {
  std::string_view name;
  FieldKind kind;
};

constexpr std::string_view kWriterPrefix = "TESSEL_";

constexpr NamedField kWriterFields[] = {
    {"KIND", FieldKind::pointKind},
    {"SUBSYSTEM", FieldKind::subsystem},
    {"CATEGORY", FieldKind::category},
    {"NAME", FieldKind::name},
    {"INTERVAL_ID", FieldKind::intervalId},
    {"INTERVAL_SCOPE", FieldKind::scope},
    {"TELEMETRY", FieldKind::telemetry},
    {"STRING1_NAME", FieldKind::string1Name},
    {"STRING1_VALUE", FieldKind::string1Value},
    {"STRING2_NAME", FieldKind::string2Name},
    {"STRING2_VALUE", FieldKind::string2Value},
    {"NUMBER1_NAME", FieldKind::number1Name},
    {"NUMBER1_VALUE", FieldKind::number1Value},
    {"NUMBER2_NAME", FieldKind::number2Name},
    {"NUMBER2_VALUE", FieldKind::number2Value},
    {"DURATION", FieldKind::duration},
    {"FRAME_RATE", FieldKind::frameRate},
    {"ATTRIBUTE", FieldKind::attribute},
};

constexpr NamedField kDaemonFields[] = {
    {"_EXE", FieldKind::imagePath},
    {"_COMM", FieldKind::processName},
    {"_PID", FieldKind::process},
};

template <size_t N>
std::optional<FieldKind> find(const NamedField (&fields)[N], std::string_view name) {
  for (const NamedField& field : fields) {
    if (field.name == name) return field.kind;
  }
  return std::nullopt;
}

}  // namespace

std::optional<FieldKind> fieldKindOf(std::string_view name) {
  if (name.starts_with('_')) return find(kDaemonFields, name);
  if (!name.starts_with(kWriterPrefix)) return std::nullopt;
  return find(kWriterFields, name.substr(kWriterPrefix.size()));
}

std::string_view malformedReasonText(MalformedReason reason) {
  switch (reason) {
    case MalformedReason::unknownKind:
      return "unknown TESSEL_KIND";
    case MalformedReason::unknownScope:
      return "unknown TESSEL_INTERVAL_SCOPE";
    case MalformedReason::invalidDuration:
      return "TESSEL_DURATION is no number";
    case MalformedReason::invalidFrameRate:
      return "TESSEL_FRAME_RATE is no number";
    case MalformedReason::invalidAttribute:
      return "TESSEL_ATTRIBUTE is not KEY=VALUE";
    case MalformedReason::valueTooLong:
      return "value over 4096 bytes";
    case MalformedReason::tooManyAttributes:
      return "more than 32 TESSEL_ATTRIBUTE";
    case MalformedReason::missingKind:
      return "missing TESSEL_KIND";
    case MalformedReason::missingSubsystem:
      return "missing TESSEL_SUBSYSTEM";
    case MalformedReason::missingCategory:
      return "missing TESSEL_CATEGORY";
  }
  return "unknown reason";
}

}  // namespace tessel
