// The bus face of the two shared tables: one GObject per table, registered on the system bus.
#ifndef LOGMGR_PROVIDERS_PROVIDER_BUS_OBJECT_H_
#define LOGMGR_PROVIDERS_PROVIDER_BUS_OBJECT_H_

namespace _CorvaneLogManager {

// Creates and registers the bus object of |tableName| ("use_app_feature_survey" or
// "report_app_status_survey"); null on failure or for another table. The provider holds the
// returned reference and drops it with ReleaseProviderBusObject.
void* CreateProviderBusObject(const char* tableName);
void ReleaseProviderBusObject(void* object);

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_PROVIDERS_PROVIDER_BUS_OBJECT_H_
