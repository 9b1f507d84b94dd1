// What drkit prints, and the JSON it reads: pure functions from values to
// text, shared by the verbs so that text and --json output come from the
// same data.
//
// JSON mapping: dictionaries are objects, arrays arrays, strings strings,
// booleans booleans, numbers numbers (a non-negative integer read from JSON
// becomes an unsigned 64-bit integer, the protocol's integer type). Values
// JSON lacks are one-key objects: {"$uuid": "CANONICAL-TEXT"},
// {"$data": "BASE64"}, {"$date": SECONDS-SINCE-1970}. JSON null is refused
// on input; an absent value is written as null.
#pragma once

#include <string>
#include <string_view>

#include "client/include/drd/client.h"
#include "core/status.h"
#include "core/value.h"

namespace dr::drkit {

// `value` as JSON: indented by two spaces when `pretty`, else on one line.
std::string ToJson(const Value& value, bool pretty = true);
// The value of a JSON text; errors name what is wrong.
Result<Value> FromJson(std::string_view text);

// The election mark of match's output: '+' elected, '-' ignored, ' ' neither.
char ElectionMark(client::Election election);

// One plug-in of match's output: "<mark> <identifier> (<version>)", and with
// `verbose` three more indented lines: uuid, path, registration time.
// Ends with a newline.
std::string PlugInLines(const client::PlugIn& plugIn, bool verbose);

// A registration time as "2026-01-31 12:00:00 UTC".
std::string FormatTime(int64_t secondsSince1970);

// An error for standard error: its text as it came, and for drd's errors
// the code's name and number: "no plugin at /x (bad path, code 9)".
std::string DescribeError(const Error& error);

}  // namespace dr::drkit
