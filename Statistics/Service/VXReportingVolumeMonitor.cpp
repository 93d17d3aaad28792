#include "Statistics/Service/VXReportingVolumeMonitor.h"
