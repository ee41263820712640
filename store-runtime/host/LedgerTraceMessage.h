#pragma once

#include <string>
#include <string_view>

#include "platform/value/PlistValue.h"

namespace larder {

// Hands a message trace to the platform's trace log and returns at once.
// The record is written later on one serial queue of the process, as one
// JSON line in "<state folder>/messagetrace.log":
//   {"date":"2024-05-01T10:00:00Z","domain":"com.orvane.Quaymart...","message":{...}}
// The folder is the one in force at the call. Safe from any thread; lines
// of concurrent callers never interleave.
void LedgerTraceMessage(std::string_view domain, const PlistDictionary& message);

// Returns once every trace handed over before the call has been written.
// For tests and for an orderly exit of tools.
void LedgerTraceMessageWaitUntilWritten();

// The log file of the current state folder.
std::string LedgerTraceMessageLogPath();

// The JSON form of one trace record, without line end. Dates become
// ISO-8601 text in UTC, data becomes base64 text.
std::string LedgerTraceMessageLine(std::string_view domain, const PlistDictionary& message,
                                   PlistDate date);

}  // namespace larder
