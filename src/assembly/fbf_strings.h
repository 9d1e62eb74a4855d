// The single table of identifiers, preference keys, bag keys, query-item
// names, header names and file names, and the numeric constants. Code names
// keys only through these tables.
#pragma once

#include <cstdint>
#include <string_view>

namespace fbf {

struct FBFStrings {
  struct Defaults {
    // Preferences, domain "vireond".
    static constexpr std::string_view DisableFlush = "VIRFeedbackFlushDisabled";
    static constexpr std::string_view FlushFrequencyInSeconds = "FlushFrequencyInSeconds";
    static constexpr std::string_view NoExitPostFlush = "FBFNoExit";
    static constexpr std::string_view LeaveFeedbackAfterUpload = "LeaveFeedbackAfterUpload";
    static constexpr std::string_view DebugQueryParameters = "VIRDebugParameters";
    // Configuration bag.
    static constexpr std::string_view FeedbackURL = "feedback_url";
    static constexpr std::string_view CrowdsourcingURL = "crowdsourcing_url";
    static constexpr std::string_view FeedbackMaxAgeInDays = "feedback_max_age_in_days";
    static constexpr std::string_view MaxFeedbackSizes = "max_custom_feedback_sizes";
    static constexpr std::string_view VireonFeedbackFormat = "vireon_feedback_format";
    static constexpr std::string_view CohortsLookbackInDays = "cohorts_lookback_in_days";
  };

  // Linux-only preferences (documented in the README).
  struct LinuxDefaults {
    // Domain "vireond": the device-information "InternalBuild" flag.
    static constexpr std::string_view InternalBuild = "InternalBuild";
    // Diagnostics-and-usage consent: domain "vireon.privacy"; absent = no consent.
    static constexpr std::string_view ConsentDomain = "vireon.privacy";
    static constexpr std::string_view DiagnosticsAndUsageEnabled = "DiagnosticsAndUsageEnabled";
    // Domain "vireond": certificate pinning and trust for uploads.
    static constexpr std::string_view UploadPinnedPublicKeys = "VIRUploadPinnedPublicKeys";
    static constexpr std::string_view UploadCAFile = "VIRUploadCAFile";
    // The search UI's preferences: the bundles disabled for search.
    static constexpr std::string_view SearchUIDomain = "vireon.scoutlume";
    static constexpr std::string_view DisabledApplications = "DisabledApplications";
    // The voice assistant's preferences.
    static constexpr std::string_view AssistantDomain = "vireon.assistant";
    static constexpr std::string_view AssistantEnabled = "Assistant Enabled";
    // Domain "vireond", for tests: seconds a "soon" whitelist update waits.
    static constexpr std::string_view WhitelistSoonDelaySeconds = "VIRWhitelistSoonDelaySeconds";
  };

  static constexpr std::string_view FBFReverseDomainIdentifier = "vireon-fbf";
  static constexpr std::string_view VireondReverseDomainIdentifier = "vireond";
  static constexpr std::string_view FeedbackFlushActivityName = "vireon-fbf.flush";
  static constexpr std::string_view WorkloopLabel = "vireon-fbf.workloop";
  static constexpr std::string_view UploadSessionTransactionName = "vireon-fbf.urlSession";
  static constexpr std::string_view FeedbackLossEventName = "vireond.feedbackLoss";
  static constexpr std::string_view kVIRAppWhitelistSignatureKey = "VIRAppWhitelistSignature";
  static constexpr std::string_view LowPriorityQueueLabel = "vireon-fbf.lowPriority";
  static constexpr std::string_view WhitelistTransactionName = "vireon-fbf.transaction";
  static constexpr std::string_view SKAppDataChangedNotification = "vireon-fbf.skapp_data_changed";
  static constexpr std::string_view VIRFileDownloadCompletedNotification = "VIRFileDownloadCompletedNotification";
  static constexpr std::string_view VireonFeedbackType = "FeedbackV2";
  static constexpr std::string_view VireonProtobufFeedbackType = "FeedbackV2PB";
  static constexpr std::string_view UploadPendingSuffix = ".uploadPending";
  static constexpr std::string_view CohortsModel = "Cohorts";
  static constexpr std::string_view CohortsDB = "cohorts.sqlite";
  static constexpr std::string_view CustomFeedbackDirectory = "CustomFeedback";

  struct QueryItems {
    static constexpr std::string_view Key = "key";
    static constexpr std::string_view Realtime = "realtime";
  };
  struct HTTPHeaders {
    static constexpr std::string_view Digest = "X-Corvane-Digest";
    static constexpr std::string_view UserAgent = "User-Agent";
    static constexpr std::string_view ContentEncoding = "Content-Encoding";
    static constexpr std::string_view ContentType = "Content-Type";
  };
  struct Paths {
    static constexpr std::string_view BagFilename = "bag.plist";
  };
};

struct FBFConstants {
  static constexpr int64_t DefaultFeedbackMaxAgeInDays = 7;
  static constexpr uint64_t DefaultMaxSessionFileSize = 2097152;
  static constexpr int MaximumNumberOfFeedbackFiles = 100;
  static constexpr int64_t OrphanedOpenFileAgeSeconds = 1800;
  static constexpr int ExitDelayAfterFlushSeconds = 10;
  static constexpr int64_t SecondsPerDay = 86400;
};

}  // namespace fbf
