#include "daemons/kavoelasticd/tokenizer.h"

#include <sqlite3.h>

#include <exception>
#include <memory>
#include <string>

#include "daemons/kavoelasticd/failure.h"
#include "daemons/kavoelasticd/tokens.h"

namespace vexlo::elasticd {
namespace {

using Emit = int (*)(void*, int, const char*, int, int, int);

Cut CutOf(int flags) {
  if ((flags & FTS5_TOKENIZE_QUERY) == 0) {
    return Cut::kDocument;
  }
  return (flags & FTS5_TOKENIZE_PREFIX) != 0 ? Cut::kPrefixQuery : Cut::kQuery;
}

int MakeWords(void* /*context*/, const char** arguments, int count, Fts5Tokenizer** out) {
  try {
    auto cutter = std::make_unique<WordCutter>(count > 0 ? arguments[0] : "none");
    *out = reinterpret_cast<Fts5Tokenizer*>(cutter.release());
    return SQLITE_OK;
  } catch (const std::exception&) {
    return SQLITE_ERROR;
  }
}

void DeleteWords(Fts5Tokenizer* tokenizer) { delete reinterpret_cast<WordCutter*>(tokenizer); }

int CutWords(Fts5Tokenizer* tokenizer, void* context, int flags, const char* text, int length,
             Emit emit) {
  int result = SQLITE_OK;
  try {
    reinterpret_cast<WordCutter*>(tokenizer)->Words(
        {text, static_cast<size_t>(length)}, CutOf(flags), [&](const Token& token) {
          result = emit(context, token.same_place ? FTS5_TOKEN_COLOCATED : 0, token.text.data(),
                        static_cast<int>(token.text.size()), static_cast<int>(token.begin),
                        static_cast<int>(token.end));
          return result == SQLITE_OK;
        });
  } catch (const std::exception&) {
    return SQLITE_NOMEM;
  }
  return result;
}

int MakeGrams(void* /*context*/, const char** /*arguments*/, int /*count*/, Fts5Tokenizer** out) {
  static char only;
  *out = reinterpret_cast<Fts5Tokenizer*>(&only);
  return SQLITE_OK;
}

void DeleteGrams(Fts5Tokenizer* /*tokenizer*/) {}

int CutGrams(Fts5Tokenizer* /*tokenizer*/, void* context, int flags, const char* text, int length,
             Emit emit) {
  // The table keeps no positions, so a query must be a single token.
  if ((flags & FTS5_TOKENIZE_QUERY) != 0) {
    return emit(context, 0, text, length, 0, length);
  }
  int result = SQLITE_OK;
  try {
    Grams({text, static_cast<size_t>(length)}, [&](std::string_view gram) {
      result = emit(context, 0, gram.data(), static_cast<int>(gram.size()), 0, length);
      return result == SQLITE_OK;
    });
  } catch (const std::exception&) {
    return SQLITE_NOMEM;
  }
  return result;
}

}  // namespace

void RegisterTokenizers(sqlite3* db) {
  fts5_api* api = nullptr;
  sqlite3_stmt* statement = nullptr;
  if (sqlite3_prepare_v2(db, "SELECT fts5(?1)", -1, &statement, nullptr) == SQLITE_OK) {
    sqlite3_bind_pointer(statement, 1, &api, "fts5_api_ptr", nullptr);
    sqlite3_step(statement);
  }
  sqlite3_finalize(statement);
  fts5_tokenizer words = {MakeWords, DeleteWords, CutWords};
  fts5_tokenizer grams = {MakeGrams, DeleteGrams, CutGrams};
  if (api == nullptr || api->xCreateTokenizer(api, "kavo", nullptr, &words, nullptr) != SQLITE_OK ||
      api->xCreateTokenizer(api, "kavograms", nullptr, &grams, nullptr) != SQLITE_OK) {
    throw Failure(Code::kStorage, "this SQLite has no FTS5");
  }
}

}  // namespace vexlo::elasticd
