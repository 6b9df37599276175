// Films, and sound that TagLib does not know, by MediaInfo.
#include <MediaInfo/MediaInfo.h>

#include <algorithm>
#include <cstdlib>
#include <string>

#include "daemons/kavocontentextractd/fault.h"
#include "daemons/kavocontentextractd/formats.h"
#include "daemons/kavocontentextractd/plain_text.h"
#include "fileindex/elastic_control/schema.h"
#include "kavo/local/content.h"

namespace vexlo::extractd {
namespace {

namespace field = fileindex::elastic::field;
namespace reason = kavo::local::content_reason;
using MediaInfoLib::MediaInfo;
using MediaInfoLib::stream_t;

constexpr size_t kBlockBytes = size_t{256} << 10;
// What is told of a stream stands at the ends of its file; whoever reads much more is led around.
constexpr uint64_t kMostRead = uint64_t{256} << 20;
constexpr size_t kMostStreams = 100;
constexpr unsigned kMostJumps = 500;

// The library's texts hold a code point in each character.
std::string Utf8(const std::wstring& text) {
  std::string utf8;
  utf8.reserve(text.size());
  for (const wchar_t character : text) {
    AppendUtf8(utf8, static_cast<char32_t>(character));
  }
  return utf8;
}

// Gives the library what it wants of the file, block by block.
void Feed(MediaInfo& media, const Source& source) {
  constexpr size_t kFinished = 8;  // A bit of the library's answer.
  constexpr uint64_t kNowhere = ~uint64_t{0};
  uint64_t at = 0;
  uint64_t read = 0;
  unsigned jumps = 0;
  media.Open_Buffer_Init(source.Size(), 0);
  while (read < kMostRead && jumps < kMostJumps) {
    const std::string block = source.Read(kBlockBytes, at);
    if (block.empty()) {
      break;
    }
    at += block.size();
    read += block.size();
    const size_t state = media.Open_Buffer_Continue(
        reinterpret_cast<const ZenLib::int8u*>(block.data()), block.size());
    if ((state & kFinished) != 0) {
      break;
    }
    if (const uint64_t wanted = media.Open_Buffer_Continue_GoTo_Get(); wanted != kNowhere) {
      at = wanted;
      ++jumps;
      media.Open_Buffer_Init(source.Size(), at);
    }
  }
  media.Open_Buffer_Finalize();
}

struct Parameter {
  const wchar_t* name;
  const char* field;
  stream_t stream;
  enum { kText, kNumber, kMilliseconds, kDate, kYear } kind;
};
// Where two rows fill one field, the later one counts; of several streams, the first.
constexpr Parameter kParameters[] = {
    {L"Duration", field::KAVOMDDurationSecond, MediaInfoLib::Stream_General,
     Parameter::kMilliseconds},
    {L"Title", field::KAVOMDTitle, MediaInfoLib::Stream_General, Parameter::kText},
    {L"Performer", field::KAVOMDAuthors, MediaInfoLib::Stream_General, Parameter::kText},
    {L"Director", field::KAVOMDAuthors, MediaInfoLib::Stream_General, Parameter::kText},
    {L"Album", field::KAVOMDAlbum, MediaInfoLib::Stream_General, Parameter::kText},
    {L"Genre", field::KAVOMDMusicalGenre, MediaInfoLib::Stream_General, Parameter::kText},
    {L"Composer", field::KAVOMDComposer, MediaInfoLib::Stream_General, Parameter::kText},
    {L"Comment", field::KAVOMDComment, MediaInfoLib::Stream_General, Parameter::kText},
    {L"Description", field::KAVOMDDescription, MediaInfoLib::Stream_General, Parameter::kText},
    {L"Copyright", field::KAVOMDCopyright, MediaInfoLib::Stream_General, Parameter::kText},
    {L"Keywords", field::KAVOMDKeywords, MediaInfoLib::Stream_General, Parameter::kText},
    {L"Track/Position", field::KAVOMDAudioTrackNumber, MediaInfoLib::Stream_General,
     Parameter::kNumber},
    {L"Recorded_Date", field::KAVOMDRecordingYear, MediaInfoLib::Stream_General, Parameter::kYear},
    {L"Encoded_Date", field::KAVOMDContentCreationDate, MediaInfoLib::Stream_General,
     Parameter::kDate},
    {L"Encoded_Application", field::KAVOMDEncodingApplications, MediaInfoLib::Stream_General,
     Parameter::kText},
    {L"OverallBitRate", field::KAVOMDTotalBitRate, MediaInfoLib::Stream_General,
     Parameter::kNumber},
    {L"Width", field::KAVOMDPixelWidth, MediaInfoLib::Stream_Video, Parameter::kNumber},
    {L"Height", field::KAVOMDPixelHeight, MediaInfoLib::Stream_Video, Parameter::kNumber},
    {L"BitRate", field::KAVOMDVideoBitRate, MediaInfoLib::Stream_Video, Parameter::kNumber},
    {L"BitRate", field::KAVOMDAudioBitRate, MediaInfoLib::Stream_Audio, Parameter::kNumber},
    {L"SamplingRate", field::KAVOMDAudioSampleRate, MediaInfoLib::Stream_Audio, Parameter::kNumber},
    {L"Channel(s)", field::KAVOMDAudioChannelCount, MediaInfoLib::Stream_Audio, Parameter::kNumber},
};

void SetParameter(const Parameter& row, std::string value, Document& document) {
  switch (row.kind) {
    case Parameter::kText:
      document.SetText(row.field, value);
      break;
    case Parameter::kNumber:
    case Parameter::kYear:
      document.SetNumber(row.field, strtoll(value.c_str(), nullptr, /*base=*/10));
      break;
    case Parameter::kMilliseconds:
      document.SetReal(row.field, strtod(value.c_str(), nullptr) / 1000);
      break;
    case Parameter::kDate:  // "UTC 2024-05-31 12:00:00" or with "UTC" behind it.
      if (const size_t zone = value.find("UTC"); zone != std::string::npos) {
        value.erase(zone, 3);
      }
      value.erase(0, value.find_first_not_of(' '));
      value.erase(value.find_last_not_of(' ') + 1);
      document.SetDate(row.field, value);
      break;
  }
}

}  // namespace

void ReadMedia(const Source& source, const std::string& /*type*/, Document& document) {
  MediaInfo media;
  // What the streams' own beginnings tell is enough.
  media.Option(L"ParseSpeed", L"0");
  media.Option(L"Internet", L"0");
  Feed(media, source);
  const struct {
    stream_t stream;
    const char* type;
  } types[] = {{MediaInfoLib::Stream_Video, "Video"},
               {MediaInfoLib::Stream_Audio, "Sound"},
               {MediaInfoLib::Stream_Text, "Text"}};
  size_t streams = 0;
  for (const auto& row : types) {
    const size_t count = std::min(media.Count_Get(row.stream), kMostStreams);
    streams += count;
    for (size_t i = 0; i < count; ++i) {
      document.AddText(field::KAVOMDMediaTypes, row.type);
      document.AddText(field::KAVOMDCodecs, Utf8(media.Get(row.stream, i, L"Format")));
    }
  }
  for (const Parameter& row : kParameters) {
    const std::string value = Utf8(media.Get(row.stream, 0, row.name));
    if (!value.empty()) {
      SetParameter(row, value, document);
    }
  }
  media.Close();
  if (streams == 0) {
    throw Fault(reason::kDamaged, "no stream of sound or pictures can be found in the file");
  }
}

}  // namespace vexlo::extractd
