// Every platform service, and the set of them that is installed for this process. The one global of
// the system.
#pragma once

#include "base/Clock.h"
#include "platform/AggregateMemory.h"
#include "platform/ChannelReportService.h"
#include "platform/DevicePropertyQuery.h"
#include "platform/DiagnosticFiles.h"
#include "platform/EventServices.h"
#include "platform/OrientationNotifier.h"
#include "platform/Preferences.h"
#include "platform/ProcessInfoQuery.h"
#include "platform/RecordedInputs.h"
#include "platform/ScopedLog.h"
#include "platform/ServiceListener.h"
#include "platform/Threading.h"
#include "platform/TracePoint.h"
#include "platform/VyrReporting.h"
#include "platform/WorkQueue.h"

namespace vx {

struct Platform {
  ServiceListener& serviceListener;
  WorkQueues& workQueues;
  Clock& clock;
  Threading& threading;
  ProcessInfoQuery& processInfo;
  ProcessControl& processControl;
  RandomSource& random;
  Preferences& preferences;
  SystemNotify& systemNotify;
  VyrReporting& vyrReporting;
  AnalyticsEventService& analytics;
  PowerEventLog& powerLog;
  ChannelReportService& channelReports;
  DevicePropertyQuery& deviceProperties;
  OrientationNotifier& orientation;
  ScopedLog& log;
  TracePoint& trace;
  DiagnosticFiles& diagnosticFiles;
  RecordedInputs& inputs;
  AggregateMemory& aggregates;
};

// The installed one. Asking before installPlatform is a programming error.
Platform& platform();
// `installed` must outlive every use. From any thread; another one's use that has begun goes on
// with what was installed. Null uninstalls (tests).
void installPlatform(Platform* installed);

}  // namespace vx
