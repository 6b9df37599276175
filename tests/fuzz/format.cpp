#include "fuzz/format.h"

#include <sys/mman.h>
#include <unistd.h>

#include <cstdlib>
#include <exception>
#include <new>

#include "common/json.h"
#include "daemons/kavocontentextractd/fault.h"
#include "fuzz/target.h"

namespace fuzz {
namespace {

constexpr size_t kMostTextBytes = size_t{1} << 20;

bool IsText(std::string_view text) {
  for (const char c : text) {
    const auto byte = static_cast<unsigned char>(c);
    if ((byte < 0x20 && (byte < '\t' || byte > '\r')) || byte == 0x7F) {
      return false;
    }
  }
  for (size_t i = text.find('\xC2'); i != std::string_view::npos && i + 1 < text.size();
       i = text.find('\xC2', i + 1)) {
    if (static_cast<unsigned char>(text[i + 1]) < 0xA0) {
      return false;  // U+0080 to U+009F, controls as well.
    }
  }
  return IsUtf8(text);
}

void CheckTexts(const Json::Value& value) {
  if (value.isString()) {
    Require(IsText(value.asString()), "a field holds what is no text");
  }
  for (const Json::Value& element : value) {
    CheckTexts(element);
  }
}

}  // namespace

int FileOf(std::string_view bytes) {
  static const int file = memfd_create("input", MFD_CLOEXEC);
  const auto length = static_cast<off_t>(bytes.size());
  Require(ftruncate(file, 0) == 0 && ftruncate(file, length) == 0 &&
              pwrite(file, bytes.data(), bytes.size(), 0) == length &&
              lseek(file, 0, SEEK_SET) == 0,
          "the file in memory cannot be made");
  return file;
}

void CheckFields(const Json::Value& fields) {
  Require(fields.isObject(), "the fields are no object");
  Require(fields["KAVOMDTextContent"].asString().size() <= kMostTextBytes, "the text has no bound");
  CheckTexts(fields);
  const std::string sent = vexlo::JsonToString(fields);
  Json::Value received;
  Require(vexlo::JsonFromString(received, sent), "the fields cannot be sent");
  RequireEqual(vexlo::JsonToString(received), sent,
               "the fields come otherwise than they were sent");
}

void CheckReader(Reader reader, const char* type, std::string_view bytes) {
  vexlo::extractd::Document document;
  std::string fault;
  try {
    reader(vexlo::extractd::Source(FileOf(bytes), "file"), type, document);
  } catch (const vexlo::extractd::Fault& thrown) {
    fault = thrown.Reason() + ": " + thrown.what();
  } catch (const std::bad_alloc&) {
    return;  // The process that reads a file ends then.
  } catch (const std::exception& thrown) {
    fault = std::string("damaged: ") + thrown.what();  // Of the library that reads the format.
  }
  CheckFields(document.Take(fault));
}

}  // namespace fuzz

// Instead of the memory limit of the processes that read files: what a library wants at once is not
// to be had either. All forms, as what one takes another gives back.
namespace {

constexpr size_t kMostAtOnce = size_t{128} << 20;

void* Allocate(size_t bytes) noexcept { return bytes > kMostAtOnce ? nullptr : malloc(bytes); }

void* AllocateOrThrow(size_t bytes) {
  void* const memory = Allocate(bytes);
  if (memory == nullptr) {
    throw std::bad_alloc();
  }
  return memory;
}

}  // namespace

#pragma GCC visibility push(default)
// Of damaged files libmediainfo leaks some bytes, which go with the process that reads them.
// NOLINTNEXTLINE(bugprone-reserved-identifier,readability-identifier-naming)
extern "C" const char* __lsan_default_suppressions() { return "leak:libmediainfo"; }
void* operator new(size_t bytes) { return AllocateOrThrow(bytes); }
void* operator new[](size_t bytes) { return AllocateOrThrow(bytes); }
void* operator new(size_t bytes, const std::nothrow_t& /*tag*/) noexcept { return Allocate(bytes); }
void* operator new[](size_t bytes, const std::nothrow_t& /*tag*/) noexcept {
  return Allocate(bytes);
}
void operator delete(void* memory) noexcept { free(memory); }
void operator delete[](void* memory) noexcept { free(memory); }
void operator delete(void* memory, size_t /*bytes*/) noexcept { free(memory); }
void operator delete[](void* memory, size_t /*bytes*/) noexcept { free(memory); }
void operator delete(void* memory, const std::nothrow_t& /*tag*/) noexcept { free(memory); }
void operator delete[](void* memory, const std::nothrow_t& /*tag*/) noexcept { free(memory); }
#pragma GCC visibility pop
