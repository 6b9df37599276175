// The cutting of tokens.h as tokenizers of SQLite's FTS5.
#ifndef DAEMONS_KAVOELASTICD_TOKENIZER_H_
#define DAEMONS_KAVOELASTICD_TOKENIZER_H_

struct sqlite3;

namespace vexlo::elasticd {

// Makes "kavo LANGUAGE" (words) and "kavograms" (parts of names) known to the connection. A query
// to a table of the second kind is passed gram by gram, as QueryGrams() gives them. Throws Failure
// kStorage when this SQLite has no FTS5.
void RegisterTokenizers(sqlite3* db);

}  // namespace vexlo::elasticd

#endif  // DAEMONS_KAVOELASTICD_TOKENIZER_H_
