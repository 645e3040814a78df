#include "platform/rozzel/identifiers.h"

namespace yomber {

std::string RZRecordZoneID::description() const { return zoneName_ + " (" + ownerName_ + ")"; }

std::string RZRecordID::description() const { return recordName_ + " in " + zoneID_.description(); }

}  // namespace yomber
