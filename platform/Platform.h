#pragma once

#include "platform/ActivationRules.h"
#include "platform/Bundles.h"
#include "platform/CodeSigning.h"
#include "platform/Containers.h"
#include "platform/Files.h"
#include "platform/Interfaces.h"
#include "platform/Locale.h"
#include "platform/Notifications.h"
#include "platform/Preferences.h"
#include "platform/PrivacyConsent.h"
#include "platform/ProcessAssertions.h"
#include "platform/Processes.h"
#include "platform/Registry.h"
#include "platform/RunLoop.h"
#include "platform/Sandbox.h"
#include "platform/ServiceManager.h"
#include "platform/Transport.h"
#include "platform/TypeConformance.h"
#include "platform/WorkQueue.h"

namespace platform {

/// Everything the daemon asks of the system around it. The log and the trace points are apart: they belong to the
/// process (SystemLog.h, TracePoints.h).
struct Platform {
    WorkQueues& queues;
    RunLoop& runLoop;
    Transport& transport;
    Registry& registry;
    ServiceManager& serviceManager;
    Sandbox& sandbox;
    CodeSigning& codeSigning;
    Bundles& bundles;
    Interfaces& interfaces;
    Preferences& preferences;
    Containers& containers;
    Notifications& notifications;
    Locale& locale;
    Processes& processes;
    Files& files;
    TypeConformance& typeConformance;
    ActivationRules& activationRules;
    PrivacyConsent& privacyConsent;
    ProcessAssertions& processAssertions;
};

} // namespace platform
