// Plain-function access to creation and configuration, kept inside the library: the exported creators of
// VelkReportingC.h stand on these.
#pragma once

#include "client/VelkReportingC.h"

extern "C" {

/// As VelkReportingClientCreateWithAggregation.
VelkReportingClient* VelkReportingCreateWithAggregation(const VelkReportingValue* sessionInfo,
                                                        const VelkReportingValue* userInfo,
                                                        const VelkReportingValue* frameworksToCheck,
                                                        VelkReportingAggregationCallback callback, void* context,
                                                        VelkReportingDestroyFunction destroy);

/// As VelkReportingClientCreate.
VelkReportingClient* VelkReportingCreate(const VelkReportingValue* sessionInfo, const VelkReportingValue* userInfo,
                                         const VelkReportingValue* frameworksToCheck);

/// As VelkReportingClientStartConfiguration.
void VelkReportingBeginConfiguration(VelkReportingClient* client, VelkReportingStatesCallback callback, void* context,
                                     VelkReportingDestroyFunction destroy);
}
