// From a file to the fields of its document.
#ifndef DAEMONS_KAVOCONTENTEXTRACTD_EXTRACT_H_
#define DAEMONS_KAVOCONTENTEXTRACTD_EXTRACT_H_

#include <json/value.h>

#include <memory>
#include <string>

struct magic_set;

namespace vexlo::extractd {

// For one thread at a time.
class Extractor {
 public:
  // Loads the table of types; throws std::runtime_error when it is not there. Makes C.UTF-8 the
  // process's locale for characters.
  Extractor();

  // The fields, or {"error":..} when there are none but a reason: see docs/extract.md. `name` is
  // the file's, without folders. Throws std::bad_alloc, after which the process should end.
  Json::Value Extract(int file, const std::string& name) const;

 private:
  std::unique_ptr<struct magic_set, void (*)(struct magic_set*)> types_;
};

}  // namespace vexlo::extractd

#endif  // DAEMONS_KAVOCONTENTEXTRACTD_EXTRACT_H_
