// The fixed log texts of the message log.
#pragma once

namespace velk::logtexts {

inline constexpr const char* kCreatingLogDirectory = "writeToLogFile: Creating velkreportingd log directory at %s";
inline constexpr const char* kErrorReadingLogDirectory =
    "writeToLogFile: Error reading from log directory: %s";  // error
inline constexpr const char* kSavedLogMessage = "writeToLogFile: Saved log message to %s";
inline constexpr const char* kLogFileArgumentsMissing =
    "createNewLogFile: both logFilePath and logFileCreationDate must not be nil";  // error
// The name of the caller in the next two is what readers of the log look for.
inline constexpr const char* kFailedToCreateLogFile =
    "writeToLogFile: Failed to create new velkreportingd log file %s";  // error
inline constexpr const char* kCreatedLogFile = "writeToLogFile: Created new velkreportingd log file %s (%s)";
inline constexpr const char* kSubmittedLogFile =
    "deleteExpiredLogFile: LogMoveForSubmission succesfully submitted log file %s (%s)";
inline constexpr const char* kDeletedLogFile = "deleteExpiredLogFile: Deleted expired velkreportingd log file %s (%s)";

}  // namespace velk::logtexts
