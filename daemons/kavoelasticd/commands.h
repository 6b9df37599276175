// The commands on the documents of one index.
#ifndef DAEMONS_KAVOELASTICD_COMMANDS_H_
#define DAEMONS_KAVOELASTICD_COMMANDS_H_

#include <json/value.h>

#include <string>

#include "daemons/kavoelasticd/failure.h"
#include "daemons/kavoelasticd/session.h"
#include "daemons/kavoelasticd/writer.h"

namespace vexlo::elasticd {

// Whether the command changes documents, and so may stand in a compound.
bool IsWrite(const std::string& command);

// Carries out a command that IsWrite(). Throws Failure; nothing has changed then, unless it is an
// SqlError.
void RunWrite(Writer& writer, const std::string& command, const Json::Value& data);

// document_move_below, which IsWrite() leaves out: what it answers with. Throws as RunWrite() does.
Json::Value MoveBelow(Writer& writer, const Json::Value& data);

// document_get_by_query: the list of documents.
Json::Value GetByQuery(Session& session, const Json::Value& data);

// data[name] as a text that is not empty. Throws Failure kBadRequest.
std::string RequiredText(const Json::Value& data, const char* name);

Json::Value Success();
Json::Value Refusal(Code code, const std::string& message);

}  // namespace vexlo::elasticd

#endif  // DAEMONS_KAVOELASTICD_COMMANDS_H_
