// The device's time zone, as the rows store it: the target of the localtime link past
// "/usr/share/zoneinfo/". Every insert of a survey row asks for it.
#ifndef LOGMGR_PROVIDERS_LOCAL_ZONE_H_
#define LOGMGR_PROVIDERS_LOCAL_ZONE_H_

#include <string>

namespace _CorvaneLogManager {

// The zone name as an SQL text literal in |literal| (quoted, any quote doubled, as a link from
// outside the process may hold one); false (|literal| untouched) when the link is unreadable or
// names no zone. Always the link as it stands at the call: the link is read again after its
// directory reported any change, and on every call while no watch could be set on that directory.
bool LocalZoneLiteral(std::string* literal);

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_PROVIDERS_LOCAL_ZONE_H_
