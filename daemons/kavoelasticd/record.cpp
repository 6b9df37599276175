#include "daemons/kavoelasticd/record.h"

#include <algorithm>
#include <cstring>
#include <utility>

#include "daemons/kavoelasticd/failure.h"

namespace vexlo::elasticd {
namespace {

bool HasBytes(Kind kind) {
  return kind == Kind::kString || kind == Kind::kInt || kind == Kind::kDouble ||
         kind == Kind::kJson;
}

void AppendNumber(std::string* out, uint64_t value) {
  while (value >= 0x80) {
    *out += static_cast<char>(value | 0x80);
    value >>= 7;
  }
  *out += static_cast<char>(value);
}

[[noreturn]] void Damaged() { throw Failure(Code::kIndexDamaged, "a stored document is damaged"); }

uint64_t TakeNumber(std::string_view* in) {
  uint64_t value = 0;
  for (int shift = 0; shift < 64; shift += 7) {
    if (in->empty()) {
      Damaged();
    }
    const auto byte = static_cast<unsigned char>(in->front());
    in->remove_prefix(1);
    value |= static_cast<uint64_t>(byte & 0x7F) << shift;
    if (byte < 0x80) {
      return value;
    }
  }
  Damaged();
}

}  // namespace

Record Record::Decode(std::string bytes) {
  Record record;
  record.owned_.push_front(std::move(bytes));
  std::string_view in = record.owned_.front();
  record.items_.reserve(32);
  while (!in.empty()) {
    const auto field = static_cast<uint32_t>(TakeNumber(&in));
    const uint64_t kind = TakeNumber(&in);
    if (kind < 1 || kind > 9 || (!record.items_.empty() && field <= record.items_.back().field)) {
      Damaged();
    }
    Item item = {field, static_cast<Kind>(kind), {}};
    if (HasBytes(item.kind)) {
      const uint64_t size = TakeNumber(&in);
      if (size > in.size() || (item.kind == Kind::kDouble && size != sizeof(double)) ||
          (item.kind == Kind::kInt && size > sizeof(int64_t))) {
        Damaged();
      }
      item.bytes = in.substr(0, size);
      in.remove_prefix(size);
    }
    record.items_.push_back(item);
  }
  return record;
}

std::string Record::Encode() const {
  std::string out;
  for (const Item& item : items_) {
    AppendNumber(&out, item.field);
    AppendNumber(&out, static_cast<uint64_t>(item.kind));
    if (HasBytes(item.kind)) {
      AppendNumber(&out, item.bytes.size());
      out += item.bytes;
    }
  }
  return out;
}

bool Record::SameStored(const Record& other) const {
  return std::equal(items_.begin(), items_.end(), other.items_.begin(), other.items_.end(),
                    [](const Item& a, const Item& b) {
                      return a.field == b.field && a.kind == b.kind &&
                             (!HasBytes(a.kind) || a.bytes == b.bytes);
                    });
}

namespace {
bool Before(const Item& item, uint32_t field) { return item.field < field; }
}  // namespace

const Item* Record::Find(uint32_t field) const {
  const auto found = std::lower_bound(items_.begin(), items_.end(), field, Before);
  return found != items_.end() && found->field == field ? &*found : nullptr;
}

void Record::Insert(const Item& item) {
  const auto found = std::lower_bound(items_.begin(), items_.end(), item.field, Before);
  if (found != items_.end() && found->field == item.field) {
    *found = item;
  } else {
    items_.insert(found, item);
  }
}

void Record::Put(uint32_t field, Kind kind, std::string bytes) {
  owned_.push_front(std::move(bytes));
  Insert({field, kind, owned_.front()});
}

void Record::PutInt(uint32_t field, int64_t value) {
  std::string bytes;
  for (int64_t rest = value;; rest >>= 8) {
    bytes += static_cast<char>(rest & 0xFF);
    // Enough once what is left is nothing but the sign of the last byte.
    if (rest >= -0x80 && rest <= 0x7F) {
      break;
    }
  }
  Put(field, Kind::kInt, std::move(bytes));
}

void Record::PutDouble(uint32_t field, double value) {
  std::string bytes(sizeof(value), '\0');
  memcpy(bytes.data(), &value, sizeof(value));
  Put(field, Kind::kDouble, std::move(bytes));
}

void Record::PutBare(uint32_t field, Kind kind) { Insert({field, kind, {}}); }

void Record::Remove(uint32_t field) {
  std::erase_if(items_, [field](const Item& item) { return item.field == field; });
}

void Record::Fill(uint32_t field, std::string text) {
  owned_.push_front(std::move(text));
  Insert({field, Kind::kBody, owned_.front()});
}

Record Record::Copy() const {
  Record copy;
  copy.items_ = items_;
  // One block for all bytes, and the items moved over to it.
  size_t size = 0;
  for (const Item& item : items_) {
    size += item.bytes.size();
  }
  std::string& block = copy.owned_.emplace_front();
  block.reserve(size + 1);
  for (Item& item : copy.items_) {
    if (item.bytes.data() != nullptr) {
      const size_t at = block.size();
      block += item.bytes;
      item.bytes = std::string_view(block.data() + at, item.bytes.size());
    }
  }
  return copy;
}

int64_t IntOf(const Item& item) {
  uint64_t value = 0;
  if (!item.bytes.empty() && (item.bytes.back() & 0x80) != 0) {
    value = ~uint64_t{0};
  }
  for (size_t i = item.bytes.size(); i-- > 0;) {
    value = (value << 8) | static_cast<unsigned char>(item.bytes[i]);
  }
  return static_cast<int64_t>(value);
}

double DoubleOf(const Item& item) {
  double value = 0;
  memcpy(&value, item.bytes.data(), std::min(sizeof(value), item.bytes.size()));
  return value;
}

}  // namespace vexlo::elasticd
