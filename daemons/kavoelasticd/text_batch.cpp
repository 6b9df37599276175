#include "daemons/kavoelasticd/text_batch.h"

#include <algorithm>
#include <utility>

namespace vexlo::elasticd {
namespace {

std::string TextSql(const std::string& table, const std::string& columns, size_t count,
                    bool forget) {
  std::string names;
  std::string marks;
  for (size_t i = 0; i < count; ++i) {
    names += columns.size() == 1 ? "," + columns + std::to_string(i) : "";
    marks += ",?";
  }
  names = columns.size() == 1 ? names : "," + columns;
  return forget ? "INSERT INTO " + table + "(" + table + ",rowid" + names + ") VALUES('delete',?" +
                      marks + ")"
                : "INSERT INTO " + table + "(rowid" + names + ") VALUES(?" + marks + ")";
}

}  // namespace

TextBatch::TextBatch(Session& session)
    : session_(session), statements_([&session] {
        const auto table = [](const char* name, const char* columns, size_t count) {
          return Statements{count, TextSql(name, columns, count, /*forget=*/false),
                            TextSql(name, columns, count, /*forget=*/true)};
        };
        const size_t texts = std::max<size_t>(1, session.schema.TextColumns().size());
        const size_t grams = std::max<size_t>(1, session.schema.GramColumns().size());
        return std::array<Statements, kTables>{table("texts", "t", texts),
                                               table("words", "name,rest,other", 3),
                                               table("grams", "g", grams)};
      }()) {}

size_t TextBatch::BytesOf(const Waiting& waiting) {
  size_t bytes = 200;  // About what the place in the map takes.
  for (const TextRow* row : {&waiting.before, &waiting.after}) {
    for (const std::string& text : *row) {
      bytes += sizeof(std::string) + text.size();
    }
  }
  return bytes;
}

void TextBatch::Put(TextTable table, int64_t id, TextRow before, TextRow after) {
  std::map<int64_t, Waiting>& changes = changes_[table];
  if (marks_ == 0 && before.empty() && changes.empty() && id > last_[table]) {
    // A new document behind all others has nothing to wait for.
    if (!after.empty()) {
      last_[table] = id;
      Run(statements_[table].insert, id, after);
    }
    return;
  }
  const auto found = changes.find(id);
  if (marks_ > 0) {
    std::optional<Waiting> was;
    if (found != changes.end()) {
      was = found->second;
    }
    steps_.push_back({table, id, std::move(was)});
  }
  if (found != changes.end()) {
    bytes_ -= BytesOf(found->second);
    found->second.after = std::move(after);
    bytes_ += BytesOf(found->second);
    return;
  }
  const auto added =
      changes.emplace_hint(changes.end(), id, Waiting{std::move(before), std::move(after)});
  bytes_ += BytesOf(added->second);
}

void TextBatch::Run(const std::string& sql, int64_t id, const TextRow& row) {
  Sql statement(session_.db, sql);
  statement.Int(id);
  for (const std::string& text : row) {
    statement.Text(text);
  }
  statement.Run();
}

void TextBatch::Write() {
  written_ = written_ || bytes_ > 0;
  for (size_t table = 0; table < kTables; ++table) {
    for (const auto& [id, waiting] : changes_[table]) {
      if (waiting.before == waiting.after) {
        continue;
      }
      if (!waiting.before.empty()) {
        Run(statements_[table].remove, id, waiting.before);
      }
      if (!waiting.after.empty()) {
        Run(statements_[table].insert, id, waiting.after);
      }
      last_[table] = std::max(last_[table], id);
    }
    changes_[table].clear();
  }
  bytes_ = 0;
  steps_.clear();
}

void TextBatch::Clear() {
  for (size_t table = 0; table < kTables; ++table) {
    changes_[table].clear();
    last_[table] = 0;
  }
  bytes_ = 0;
  DropMarks();
}

size_t TextBatch::SetMark() {
  ++marks_;
  return steps_.size();
}

bool TextBatch::Undo(size_t mark) {
  if (written_) {
    return false;
  }
  while (steps_.size() > mark) {
    Step& step = steps_.back();
    std::map<int64_t, Waiting>& changes = changes_[step.table];
    const auto found = changes.find(step.id);
    bytes_ -= BytesOf(found->second);
    if (step.before) {
      found->second = *std::move(step.before);
      bytes_ += BytesOf(found->second);
    } else {
      changes.erase(found);
    }
    steps_.pop_back();
  }
  return true;
}

void TextBatch::DropMarks() {
  steps_.clear();
  marks_ = 0;
  written_ = false;
}

}  // namespace vexlo::elasticd
