// Photos and other pictures by Exiv2.
#include <exiv2/exiv2.hpp>

#include <cmath>
#include <cstdio>
#include <iterator>
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

constexpr size_t kMostBytes = size_t{1} << 30;

enum class Kind {
  kText,
  kShown,  // As people read it: "Center weighted average".
  kList,   // Of texts.
  kNumber,
  kReal,
  kDate,   // With the zone of another tag, if that is there.
  kOnOff,  // The last bit.
};

struct Tag {
  const char* key;  // "Exif.Image.Make"; the first three letters say of which family.
  const char* field;
  Kind kind;
  const char* zone = nullptr;  // The key of a date's zone.
};
// Where two rows fill one field, the later one counts.
constexpr Tag kTags[] = {
    {"Exif.Image.Make", field::KAVOMDAcquisitionMake, Kind::kText},
    {"Exif.Image.Model", field::KAVOMDAcquisitionModel, Kind::kText},
    {"Exif.Image.Software", field::KAVOMDCreator, Kind::kText},
    {"Exif.Image.Artist", field::KAVOMDAuthors, Kind::kList},
    {"Exif.Image.Copyright", field::KAVOMDCopyright, Kind::kText},
    {"Exif.Image.ImageDescription", field::KAVOMDDescription, Kind::kText},
    {"Exif.Image.Orientation", field::KAVOMDOrientation, Kind::kNumber},
    {"Exif.Image.XResolution", field::KAVOMDResolutionWidthDPI, Kind::kNumber},
    {"Exif.Image.YResolution", field::KAVOMDResolutionHeightDPI, Kind::kNumber},
    {"Exif.Image.BitsPerSample", field::KAVOMDBitsPerSample, Kind::kNumber},
    {"Exif.Image.DateTime", field::KAVOMDContentCreationDate, Kind::kDate, "Exif.Photo.OffsetTime"},
    {"Exif.Photo.DateTimeOriginal", field::KAVOMDContentCreationDate, Kind::kDate,
     "Exif.Photo.OffsetTimeOriginal"},
    {"Exif.Photo.UserComment", field::KAVOMDComment, Kind::kText},
    {"Exif.Photo.ExposureTime", field::KAVOMDExposureTimeSeconds, Kind::kReal},
    {"Exif.Photo.ExposureTime", field::KAVOMDExposureTimeString, Kind::kShown},
    {"Exif.Photo.FNumber", field::KAVOMDFNumber, Kind::kReal},
    {"Exif.Photo.FNumber", field::KAVOMDAperture, Kind::kShown},
    {"Exif.Photo.MaxApertureValue", field::KAVOMDMaxAperture, Kind::kShown},
    {"Exif.Photo.FocalLength", field::KAVOMDFocalLength, Kind::kReal},
    {"Exif.Photo.ISOSpeedRatings", field::KAVOMDISOSpeed, Kind::kNumber},
    {"Exif.Photo.ExposureMode", field::KAVOMDExposureMode, Kind::kShown},
    {"Exif.Photo.ExposureProgram", field::KAVOMDExposureProgram, Kind::kShown},
    {"Exif.Photo.MeteringMode", field::KAVOMDMeteringMode, Kind::kShown},
    {"Exif.Photo.WhiteBalance", field::KAVOMDWhiteBalance, Kind::kShown},
    {"Exif.Photo.ColorSpace", field::KAVOMDColorSpace, Kind::kShown},
    {"Exif.Photo.Flash", field::KAVOMDFlashOnOff, Kind::kOnOff},
    {"Exif.Photo.ExifVersion", field::KAVOMDEXIFVersion, Kind::kShown},
    {"Iptc.Application2.ObjectName", field::KAVOMDTitle, Kind::kText},
    {"Iptc.Application2.Headline", field::KAVOMDHeadline, Kind::kText},
    {"Iptc.Application2.Caption", field::KAVOMDDescription, Kind::kText},
    {"Iptc.Application2.Keywords", field::KAVOMDKeywords, Kind::kList},
    {"Iptc.Application2.Byline", field::KAVOMDAuthors, Kind::kList},
    {"Iptc.Application2.Copyright", field::KAVOMDCopyright, Kind::kText},
    {"Iptc.Application2.City", field::KAVOMDCity, Kind::kText},
    {"Iptc.Application2.ProvinceState", field::KAVOStateOrProvince, Kind::kText},
    {"Iptc.Application2.CountryName", field::KAVOMDCountry, Kind::kText},
    {"Iptc.Application2.SpecialInstructions", field::KAVOMDInstructions, Kind::kText},
    {"Xmp.dc.title", field::KAVOMDTitle, Kind::kText},
    {"Xmp.dc.description", field::KAVOMDDescription, Kind::kText},
    {"Xmp.dc.subject", field::KAVOMDKeywords, Kind::kList},
    {"Xmp.dc.creator", field::KAVOMDAuthors, Kind::kList},
    {"Xmp.xmp.Rating", field::KAVOMDStarRating, Kind::kText},
    {"Xmp.photoshop.City", field::KAVOMDCity, Kind::kText},
    {"Xmp.photoshop.Country", field::KAVOMDCountry, Kind::kText},
};

// Cameras and older programs write their system's encoding, and none says which it is.
std::string Utf8(const std::string& text) {
  return IsUtf8(text, /*has_more=*/false) ? text : Convert(text, "windows-1252").value_or(text);
}

// Of a text in several languages the one that the file prefers, or else the first.
template <typename Datum>
std::string TextOf(const Datum& datum) {
  if (const auto* const texts = dynamic_cast<const Exiv2::LangAltValue*>(&datum.value());
      texts != nullptr && !texts->value_.empty()) {
    const auto preferred = texts->value_.find("x-default");
    return preferred == texts->value_.end() ? texts->value_.begin()->second : preferred->second;
  }
  if (const auto* const comment = dynamic_cast<const Exiv2::CommentValue*>(&datum.value())) {
    return Utf8(comment->comment());
  }
  return Utf8(datum.toString());
}

template <typename Datum>
void SetTag(const Tag& tag, const Datum& datum, const std::string& shown, Document& document) {
  switch (tag.kind) {
    case Kind::kText:
      document.SetText(tag.field, TextOf(datum));
      break;
    case Kind::kShown:
      document.SetText(tag.field, shown);
      break;
    case Kind::kList:
      for (long i = 0; i < std::min(datum.count(), 256L); ++i) {
        document.AddText(tag.field, Utf8(datum.typeId() == Exiv2::asciiString ? datum.toString()
                                                                              : datum.toString(i)));
        if (datum.typeId() == Exiv2::asciiString || datum.typeId() == Exiv2::string) {
          break;  // It counts its characters.
        }
      }
      break;
    case Kind::kNumber:
      document.SetNumber(tag.field, datum.toLong());
      break;
    case Kind::kReal:
      document.SetReal(tag.field, datum.toFloat());
      break;
    case Kind::kDate:
      document.SetDate(tag.field, datum.toString());
      break;
    case Kind::kOnOff:
      document.SetText(tag.field, (datum.toLong() & 1) != 0 ? "on" : "off");
      break;
  }
}

// Cameras without a zone leave its tag blank, and the date as it is.
void SetZone(const Tag& tag, const std::string& date, const Exiv2::ExifData& data,
             Document& document) {
  const auto zone =
      tag.zone == nullptr ? data.end() : data.findKey(Exiv2::ExifKey(std::string(tag.zone)));
  if (zone != data.end()) {
    document.SetDate(tag.field, date + zone->toString());
  }
}

void ReadTag(const Exiv2::Image& image, const Tag& tag, Document& document) {
  const std::string key = tag.key;
  if (key.starts_with("Exif")) {
    const Exiv2::ExifData& data = image.exifData();
    const auto found = data.findKey(Exiv2::ExifKey(key));
    if (found != data.end() && found->count() > 0) {
      SetTag(tag, *found, tag.kind == Kind::kShown ? found->print(&data) : "", document);
      SetZone(tag, found->toString(), data, document);
    }
  } else if (key.starts_with("Iptc")) {
    for (const Exiv2::Iptcdatum& datum : image.iptcData()) {
      if (datum.key() == key) {  // A list has a datum for each.
        SetTag(tag, datum, "", document);
      }
    }
  } else {
    const Exiv2::XmpData& data = image.xmpData();
    const auto found = data.findKey(Exiv2::XmpKey(key));
    if (found != data.end() && found->count() > 0) {
      SetTag(tag, *found, "", document);
    }
  }
}

// Degrees of three rationals: degrees, minutes, seconds. NaN without them.
double Degrees(const Exiv2::ExifData& data, const char* key, const char* reference, char negative) {
  const auto found = data.findKey(Exiv2::ExifKey(key));
  if (found == data.end() || found->count() != 3) {
    return NAN;
  }
  double degrees = 0;
  double unit = 1;
  for (long i = 0; i < 3; ++i, unit /= 60) {
    const Exiv2::Rational part = found->toRational(i);
    if (part.second == 0) {  // So cameras write that they do not know.
      return NAN;
    }
    degrees += static_cast<double>(part.first) / part.second * unit;
  }
  const auto side = data.findKey(Exiv2::ExifKey(reference));
  const bool is_negative = side != data.end() && side->toString().starts_with(negative);
  return is_negative ? -degrees : degrees;
}

void ReadPlace(const Exiv2::ExifData& data, Document& document) {
  const double latitude =
      Degrees(data, "Exif.GPSInfo.GPSLatitude", "Exif.GPSInfo.GPSLatitudeRef", 'S');
  const double longitude =
      Degrees(data, "Exif.GPSInfo.GPSLongitude", "Exif.GPSInfo.GPSLongitudeRef", 'W');
  if (std::abs(latitude) <= 90 && std::abs(longitude) <= 180) {
    document.SetPlace(latitude, longitude);
  }
}

}  // namespace

void ReadPhoto(const Source& source, const std::string& /*type*/, Document& document) {
  Exiv2::LogMsg::setLevel(Exiv2::LogMsg::mute);
  Exiv2::enableBMFF();
  const Mapping file(source, kMostBytes);
  try {
    const auto image =
        Exiv2::ImageFactory::open(reinterpret_cast<const Exiv2::byte*>(file.Bytes().data()),
                                  static_cast<long>(file.Bytes().size()));
    image->readMetadata();
    const int64_t width = image->pixelWidth();
    const int64_t height = image->pixelHeight();
    document.SetNumber(field::KAVOMDPixelWidth, width);
    document.SetNumber(field::KAVOMDPixelHeight, height);
    document.SetNumber(field::KAVOMDPixelCount, width * height);
    for (const Tag& tag : kTags) {
      ReadTag(*image, tag, document);
    }
    ReadPlace(image->exifData(), document);
  } catch (const Exiv2::AnyError& error) {
    // Of pictures that the library does not know nothing is missing.
    if (error.code() != Exiv2::kerMemoryContainsUnknownImageType) {
      throw Fault(reason::kDamaged, std::string("the picture cannot be read, ") + error.what());
    }
  }
}

}  // namespace vexlo::extractd
