// Report-side system metrics, added at serialization time.
#include "report/report.h"

// Seams for the report-side metrics (installed apps, metadata, store size,
// CPU uptime, memory freezer); the metrics work fills them in.
void TBReport::addInstalledAppInfo() {}
void TBReport::addMetadataKeys() {}
void TBReport::reportDatabaseSize() {}
void TBReport::reportVMStats() {}
void TBReport::reportCPUUptime() {}
