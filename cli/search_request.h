// What a person looks for, as the search engine is asked.
#ifndef CLI_SEARCH_REQUEST_H_
#define CLI_SEARCH_REQUEST_H_

#include <json/value.h>

#include "cli/command.h"

namespace vexlo::cli {

// The engine's request for the arguments of "fileindex search": words, and the options that narrow,
// sort and limit. Says nothing about snippets or where the page begins. Throws UsageError for a
// value that is none, and when nothing is looked for.
Json::Value MakeSearchRequest(const Arguments& arguments);

}  // namespace vexlo::cli

#endif  // CLI_SEARCH_REQUEST_H_
