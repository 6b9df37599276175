// Sound files by TagLib.
#include <taglib/audioproperties.h>
#include <taglib/fileref.h>
#include <taglib/tfilestream.h>
#include <taglib/tpropertymap.h>
#include <unistd.h>

#include <fcntl.h>

#include <algorithm>
#include <cstdint>
#include <cstdlib>
#include <iterator>
#include <string>
#include <string_view>

#include "daemons/kavocontentextractd/fault.h"
#include "daemons/kavocontentextractd/formats.h"
#include "fileindex/elastic_control/schema.h"
#include "kavo/local/content.h"

namespace vexlo::extractd {
namespace {

namespace field = fileindex::elastic::field;
namespace reason = kavo::local::content_reason;

struct Property {
  const char* name;
  const char* field;
  bool is_list;
};
constexpr Property kProperties[] = {
    {"TITLE", field::KAVOMDTitle, false},
    {"ARTIST", field::KAVOMDAuthors, true},
    {"ALBUMARTIST", field::KAVOMDAuthors, true},
    {"ALBUM", field::KAVOMDAlbum, false},
    {"GENRE", field::KAVOMDMusicalGenre, false},
    {"COMPOSER", field::KAVOMDComposer, true},
    {"LYRICIST", field::KAVOMDLyricist, true},
    {"COMMENT", field::KAVOMDComment, false},
    {"DESCRIPTION", field::KAVOMDDescription, false},
    {"COPYRIGHT", field::KAVOMDCopyright, false},
    {"LANGUAGE", field::KAVOMDLanguages, true},
    {"ENCODEDBY", field::KAVOMDAudioEncodingApplication, false},
    {"ENCODER", field::KAVOMDAudioEncodingApplication, false},
    {"INITIALKEY", field::KAVOMDKeySignature, false},
};

void ReadProperties(const TagLib::PropertyMap& properties, Document& document) {
  for (const Property& row : kProperties) {
    const auto found = properties.find(row.name);
    if (found == properties.end() || found->second.isEmpty()) {
      continue;
    }
    if (row.is_list) {
      for (const TagLib::String& value : found->second) {
        document.AddText(row.field, value.to8Bit(/*unicode=*/true));
      }
    } else {
      document.SetText(row.field, found->second.toString(" / ").to8Bit(/*unicode=*/true));
    }
  }
  // "3/12" is the third of twelve, "2019-05-31" a day of the year.
  const struct {
    const char* name;
    const char* field;
  } numbers[] = {{"TRACKNUMBER", field::KAVOMDAudioTrackNumber},
                 {"DATE", field::KAVOMDRecordingYear},
                 {"BPM", field::KAVOMDTempo}};
  for (const auto& row : numbers) {
    if (const auto found = properties.find(row.name);
        found != properties.end() && !found->second.isEmpty()) {
      document.SetNumber(row.field,
                         strtol(found->second.front().toCString(), nullptr, /*base=*/10));
    }
  }
}

// Whether files of the type hold notes, instruments or programs that play them: what is told of
// recordings is not missing there.
bool IsScore(const std::string& type) {
  constexpr std::string_view kTypes[] = {
      "audio/mid",   "audio/midi",  "audio/x-idf", "audio/x-mids", "audio/x-mod", "audio/x-psf",
      "audio/x-s3m", "audio/x-sap", "audio/x-syx", "audio/x-sfbk", "audio/x-vgm"};
  return std::find(std::begin(kTypes), std::end(kTypes), type) != std::end(kTypes);
}

// Whether it is a WAV without a length, as one has that was written to a pipe: programs write none
// or the largest of 32 bits, with a sign or without.
bool IsEndlessWav(const Source& source) {
  constexpr size_t kSizeAt = 4;
  constexpr size_t kSizeBytes = 4;
  constexpr uint8_t kLargest = 0x7F;  // Of its last byte.
  const std::string head = source.Read(kSizeAt + kSizeBytes);
  const std::string_view size = std::string_view(head).substr(std::min(kSizeAt, head.size()));
  return head.starts_with("RIFF") && size.size() == kSizeBytes &&
         (static_cast<uint8_t>(size.back()) >= kLargest ||
          size.find_first_not_of('\0') == std::string_view::npos);
}

void ReadOther(const Source& source, const std::string& type, Document& document) {
  try {
    ReadMedia(source, type, document);  // It knows more formats, and less of each.
  } catch (const Fault& fault) {
    if (fault.Reason() != reason::kDamaged || !IsScore(type)) {
      throw;
    }
  }
}

}  // namespace

void ReadAudio(const Source& source, const std::string& type, Document& document) {
  constexpr int kBitsPerKilobit = 1000;
  // The library closes its descriptor, and shares the offset with this one.
  const int copy = fcntl(source.Fd(), F_DUPFD_CLOEXEC, 0);
  TagLib::FileStream stream(copy, /*openReadOnly=*/true);
  if (!stream.isOpen()) {
    throw Fault(reason::kUnreadable, "the file cannot be opened");
  }
  stream.seek(0);
  const TagLib::FileRef file(&stream);
  if (file.isNull()) {
    ReadOther(source, type, document);
    return;
  }
  const TagLib::AudioProperties* const sound = file.audioProperties();
  if (sound != nullptr) {
    document.SetReal(field::KAVOMDDurationSecond, sound->lengthInMilliseconds() / 1000.0);
    document.SetNumber(field::KAVOMDAudioBitRate, int64_t{sound->bitrate()} * kBitsPerKilobit);
    document.SetNumber(field::KAVOMDAudioSampleRate, sound->sampleRate());
    document.SetNumber(field::KAVOMDAudioChannelCount, sound->channels());
  }
  document.AddText(field::KAVOMDMediaTypes, "Sound");
  ReadProperties(file.file()->properties(), document);
  // A recording that was written to a pipe says no length; on such a WAV the library gives up.
  const bool has_sound = file.file()->isValid() && sound != nullptr &&
                         (sound->lengthInMilliseconds() > 0 || sound->sampleRate() > 0);
  if (!has_sound && IsEndlessWav(source)) {
    ReadMedia(source, type, document);
  } else if (!has_sound) {
    throw Fault(reason::kDamaged, "the sound cannot be found in the file");
  }
}

}  // namespace vexlo::extractd
