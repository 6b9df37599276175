// Sound files by TagLib.
#include <taglib/audioproperties.h>
#include <taglib/fileref.h>
#include <taglib/tfilestream.h>
#include <taglib/tpropertymap.h>
#include <unistd.h>

#include <fcntl.h>

#include <cstdlib>
#include <string>

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
    ReadMedia(source, type, document);  // It knows more formats, and less of each.
    return;
  }
  if (const TagLib::AudioProperties* const sound = file.audioProperties()) {
    document.SetReal(field::KAVOMDDurationSecond, sound->lengthInMilliseconds() / 1000.0);
    document.SetNumber(field::KAVOMDAudioBitRate, int64_t{sound->bitrate()} * kBitsPerKilobit);
    document.SetNumber(field::KAVOMDAudioSampleRate, sound->sampleRate());
    document.SetNumber(field::KAVOMDAudioChannelCount, sound->channels());
  }
  document.AddText(field::KAVOMDMediaTypes, "Sound");
  ReadProperties(file.file()->properties(), document);
  if (!file.file()->isValid() || file.audioProperties() == nullptr ||
      file.audioProperties()->lengthInMilliseconds() == 0) {
    throw Fault(reason::kDamaged, "the sound cannot be found in the file");
  }
}

}  // namespace vexlo::extractd
