// A document's fields as they are kept in the database. Pure; for one thread at a time.
#ifndef DAEMONS_KAVOELASTICD_RECORD_H_
#define DAEMONS_KAVOELASTICD_RECORD_H_

#include <cstdint>
#include <forward_list>
#include <string>
#include <string_view>
#include <vector>

namespace vexlo::elasticd {

// Stored: never renumber.
enum class Kind : uint8_t {
  kString = 1,
  kInt = 2,     // Least bytes of two's complement, the lowest first.
  kDouble = 3,  // 8 bytes of this machine.
  kTrue = 4,
  kFalse = 5,
  kParent = 6,  // The folder of the document's path. So a rename leaves the record as it is.
  kName = 7,    // The last component of the document's path.
  kJson = 8,    // A list or an object, as JSON.
  kBody = 9,    // A text that stands in a row of its own.
};

struct Item {
  uint32_t field;
  Kind kind;
  // For kBody, the text where it is known; its data is null where it is not.
  std::string_view bytes;
};

// Items in the order of their fields, one a field. Move-only: items point into what it owns.
class Record {
 public:
  Record() = default;
  Record(Record&&) = default;
  Record& operator=(Record&&) = default;
  Record(const Record&) = delete;
  Record& operator=(const Record&) = delete;
  ~Record() = default;

  // Reads what Encode() wrote. Throws Failure kIndexDamaged for anything else.
  static Record Decode(std::string bytes);
  // One byte run of field, kind and length with the bytes behind them; texts of kBody are left out.
  std::string Encode() const;

  // Whether Encode() gives the same for both.
  bool SameStored(const Record& other) const;

  const std::vector<Item>& Items() const { return items_; }
  const Item* Find(uint32_t field) const;
  // Sets a field's value, instead of another one.
  void Put(uint32_t field, Kind kind, std::string bytes);
  void PutInt(uint32_t field, int64_t value);
  void PutDouble(uint32_t field, double value);
  // Sets a field to a value without bytes of its own, also to a text of the body not known yet.
  void PutBare(uint32_t field, Kind kind);
  void Remove(uint32_t field);
  // Fills in the text of a kBody item.
  void Fill(uint32_t field, std::string text);
  Record Copy() const;

 private:
  void Insert(const Item& item);

  std::vector<Item> items_;
  std::forward_list<std::string> owned_;
};

int64_t IntOf(const Item& item);
double DoubleOf(const Item& item);

}  // namespace vexlo::elasticd

#endif  // DAEMONS_KAVOELASTICD_RECORD_H_
