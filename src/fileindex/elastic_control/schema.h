// What the search engine is told about a share's documents: the names of their fields, and how each
// field is stored and searched.
#ifndef FILEINDEX_ELASTIC_CONTROL_SCHEMA_H_
#define FILEINDEX_ELASTIC_CONTROL_SCHEMA_H_

#include "fileindex/paths.h"

namespace vexlo::fileindex::elastic {

// The mappings document as JSON text; GetFileIndexMappings() hands it out parsed.
//
// "property_id" names the field whose value identifies a document, "default" the attributes of
// every field that "properties" does not list, "properties" what is different for those it does.
// The path is kept out of the catch-all search; a file name is searched by its lower-cased n-gram
// copy, and a folder by the list of ancestors that the engine makes of a parent path.
extern const char kMappingsText[];

// The metadata fields of a document. Each name is a key of documents that are stored already, so
// every spelling stays, irregular ones included. The mappings know the fields of kFinderLabel and
// kGroupId without the underscore.
namespace field {

inline constexpr char kAttributeChangeDate[] = "KAVOMDAttributeChangeDate";
inline constexpr char kAudiences[] = "KAVOMDAudiences";
inline constexpr char kAuthors[] = "KAVOMDAuthors";
inline constexpr char kAuthorAddresses[] = "KAVOMDAuthorAddresses";
inline constexpr char kCity[] = "KAVOMDCity";
inline constexpr char kComment[] = "KAVOMDComment";
inline constexpr char kContactKeywords[] = "KAVOMDContactKeywords";
inline constexpr char kContentCreationDate[] = "KAVOMDContentCreationDate";
inline constexpr char kContentModificationDate[] = "KAVOMDContentModificationDate";
inline constexpr char kContentType[] = "KAVOMDContentType";
inline constexpr char kContentTypeTree[] = "KAVOMDContentTypeTree";
inline constexpr char kContributors[] = "KAVOMDContributors";
inline constexpr char kCopyright[] = "KAVOMDCopyright";
inline constexpr char kCountry[] = "KAVOMDCountry";
inline constexpr char kCoverage[] = "KAVOMDCoverage";
inline constexpr char kCreator[] = "KAVOMDCreator";
inline constexpr char kDescription[] = "KAVOMDDescription";
inline constexpr char kDisplayName[] = "KAVOMDDisplayName";
inline constexpr char kDueDate[] = "KAVOMDDueDate";
inline constexpr char kDurationSecond[] = "KAVOMDDurationSecond";
inline constexpr char kEmailAddresses[] = "KAVOMDEmailAddresses";
inline constexpr char kEncodingApplications[] = "KAVOMDEncodingApplications";
inline constexpr char kFinderComment[] = "KAVOMDFinderComment";
inline constexpr char kFonts[] = "KAVOMDFonts";
inline constexpr char kHeadline[] = "KAVOMDHeadline";
inline constexpr char kIdentifier[] = "KAVOMDIdentifier";
inline constexpr char kInstantMessageAddresses[] = "KAVOMDInstantMessageAddresses";
inline constexpr char kInstructions[] = "KAVOMDInstructions";
inline constexpr char kKeywords[] = "KAVOMDKeywords";
inline constexpr char kKind[] = "KAVOMDKind";
inline constexpr char kLanguages[] = "KAVOMDLanguages";
inline constexpr char kLastUsedDate[] = "KAVOMDLastUsedDate";
inline constexpr char kNumberOfPages[] = "KAVOMDNumberOfPages";
inline constexpr char kNamedLocation[] = "KAVOMDNamedLocation";
inline constexpr char kOrganizations[] = "KAVOMDOrganizations";
inline constexpr char kPageHeight[] = "KAVOMDPageHeight";
inline constexpr char kPageWidth[] = "KAVOMDPageWidth";
inline constexpr char kParticipants[] = "KAVOMDParticipants";
inline constexpr char kPhoneNumbers[] = "KAVOMDPhoneNumbers";
inline constexpr char kProjects[] = "KAVOMDProjects";
inline constexpr char kPublishers[] = "KAVOMDPublishers";
inline constexpr char kRecipients[] = "KAVOMDRecipients";
inline constexpr char kRecipientAddresses[] = "KAVOMDRecipientAddresses";
inline constexpr char kRights[] = "KAVOMDRights";
inline constexpr char kSecurityMethod[] = "KAVOMDSecurityMethod";
inline constexpr char kStarRating[] = "KAVOMDStarRating";
inline constexpr char kStateOrProvince[] = "KAVOStateOrProvince";
inline constexpr char kTextContent[] = "KAVOMDTextContent";
inline constexpr char kTitle[] = "KAVOMDTitle";
inline constexpr char kVersion[] = "KAVOMDVersion";
inline constexpr char kWhereFroms[] = "KAVOMDWhereFroms";
inline constexpr char kAcquisitionMake[] = "KAVOMDAcquisitionMake";
inline constexpr char kAcquisitionModel[] = "KAVOMDAcquisitionModel";
inline constexpr char kAlbum[] = "KAVOMDAlbum";
inline constexpr char kAperture[] = "KAVOMDAperture";
inline constexpr char kBitsPerSample[] = "KAVOMDBitsPerSample";
inline constexpr char kColorSpace[] = "KAVOMDColorSpace";
inline constexpr char kEXIFVersion[] = "KAVOMDEXIFVersion";
inline constexpr char kExposureMode[] = "KAVOMDExposureMode";
inline constexpr char kExposureProgram[] = "KAVOMDExposureProgram";
inline constexpr char kExposureTimeSeconds[] = "KAVOMDExposureTimeSeconds";
inline constexpr char kExposureTimeString[] = "KAVOMDExposureTimeString";
inline constexpr char kFNumber[] = "KAVOMDFNumber";
inline constexpr char kFlashOnOff[] = "KAVOMDFlashOnOff";
inline constexpr char kFocalLength[] = "KAVOMDFocalLength";
inline constexpr char kHasAlphaChannel[] = "KAVOMDHasAlphaChannel";
inline constexpr char kISOSpeed[] = "KAVOMDISOSpeed";
inline constexpr char kLayerNames[] = "KAVOMDLayerNames";
inline constexpr char kMaxAperture[] = "KAVOMDMaxAperture";
inline constexpr char kMeteringMode[] = "KAVOMDMeteringMode";
inline constexpr char kOrientation[] = "KAVOMDOrientation";
inline constexpr char kPixelHeight[] = "KAVOMDPixelHeight";
inline constexpr char kPixelWidth[] = "KAVOMDPixelWidth";
inline constexpr char kPixelCount[] = "KAVOMDPixelCount";
inline constexpr char kProfileName[] = "KAVOMDProfileName";
inline constexpr char kRedEyeOnOff[] = "KAVOMDRedEyeOnOff";
inline constexpr char kResolutionHeightDPI[] = "KAVOMDResolutionHeightDPI";
inline constexpr char kResolutionWidthDPI[] = "KAVOMDResolutionWidthDPI";
inline constexpr char kWhiteBalance[] = "KAVOMDWhiteBalance";
inline constexpr char kAudioBitRate[] = "KAVOMDAudioBitRate";
inline constexpr char kCodecs[] = "KAVOMDCodecs";
inline constexpr char kDeliveryType[] = "KAVOMDDeliveryType";
inline constexpr char kMediaTypes[] = "KAVOMDMediaTypes";
inline constexpr char kStreamable[] = "KAVOMDStreamable";
inline constexpr char kTotalBitRate[] = "KAVOMDTotalBitRate";
inline constexpr char kVideoBitRate[] = "KAVOMDVideoBitRate";
inline constexpr char kAppleLoopDescriptors[] = "KAVOMDAppleLoopDescriptors";
inline constexpr char kAppleLoopsKeyFilterType[] = "KAVOMDAppleLoopsKeyFilterType";
inline constexpr char kAppleLoopsLoopMode[] = "KAVOMDAppleLoopsLoopMode";
inline constexpr char kAppleLoopsRootKey[] = "KAVOMDAppleLoopsRootKey";
inline constexpr char kAudioChannelCount[] = "KAVOMDAudioChannelCount";
inline constexpr char kAudioEncodingApplication[] = "KAVOMDAudioEncodingApplication";
inline constexpr char kAudioSampleRate[] = "KAVOMDAudioSampleRate";
inline constexpr char kAudioTrackNumber[] = "KAVOMDAudioTrackNumber";
inline constexpr char kComposer[] = "KAVOMDComposer";
inline constexpr char kGeneralMIDISequence[] = "KAVOMDGeneralMIDISequence";
inline constexpr char kKeySignature[] = "KAVOMDKeySignature";
inline constexpr char kLyricist[] = "KAVOMDLyricist";
inline constexpr char kMusicalGenre[] = "KAVOMDMusicalGenre";
inline constexpr char kMusicalInstrumentCategory[] = "KAVOMDMusicalInstrumentCategory";
inline constexpr char kMusicalInstrumentName[] = "KAVOMDMusicalInstrumentName";
inline constexpr char kRecodingDate[] = "KAVOMDRecodingDate";
inline constexpr char kRecordingYear[] = "KAVOMDRecordingYear";
inline constexpr char kTempo[] = "KAVOMDTempo";
inline constexpr char kTimeSignature[] = "KAVOMDTimeSignature";
inline constexpr char kFSContentChangeDate[] = "KAVOMDFSContentChangeDate";
inline constexpr char kFSCreationDate[] = "KAVOMDFSCreationDate";
inline constexpr char kFSInvisible[] = "KAVOMDFSInvisible";
inline constexpr char kFSIsExtensionHidden[] = "KAVOMDFSIsExtensionHidden";
inline constexpr char kFSLabel[] = "KAVOMDFSLabel";
inline constexpr char kFSName[] = "KAVOMDFSName";
inline constexpr char kFSNodeCount[] = "KAVOMDFSNodeCount";
inline constexpr char kOwnerGroupID[] = "KAVOMDOwnerGroupID";
inline constexpr char kOwnerUserID[] = "KAVOMDOwnerUserID";
inline constexpr char kFSSize[] = "KAVOMDFSSize";
inline constexpr char kPath[] = "KAVOMDPath";
inline constexpr char kUserTags[] = "_KAVOMDUserTags";
inline constexpr char kParent[] = "KAVOMDParent";
inline constexpr char kSearchFileName[] = "KAVOMDSearchFileName";
inline constexpr char kSearchAncestor[] = "KAVOMDSearchAncestor";
inline constexpr char kExtension[] = "KAVOMDExtension";
inline constexpr char kPrivilege[] = "KAVOMDPrivilege";
inline constexpr char kIsDir[] = "KAVOMDIsDir";
inline constexpr char kWildcard[] = "KAVOMDWildcard";
inline constexpr char kIsEncrypted[] = "KAVOMDIsEncrypted";
inline constexpr char kFinderLabel[] = "_KAVOMDFinderLabel";
inline constexpr char kGroupId[] = "_KAVOMDGroupId";
inline constexpr char kFinderOpenDate[] = "KAVOMDFinderOpenDate";
inline constexpr char kLogicalSize[] = "KAVOMDLogicalSize";
inline constexpr char kPhysicalSize[] = "KAVOMDPhysicalSize";
inline constexpr char kDateAdded[] = "KAVOMDDateAdded";
inline constexpr char kPeopleDisplayName[] = "KAVOMDPeopleDisplayName";
inline constexpr char kSubject[] = "KAVOMDSubject";
inline constexpr char kPageCount[] = "KAVOMDPageCount";
inline constexpr char kWordCount[] = "KAVOMDWordCount";
inline constexpr char kTemplate[] = "KAVOMDTemplate";
inline constexpr char kLicense[] = "KAVOMDLicense";
inline constexpr char kCategory[] = "KAVOMDCategory";
inline constexpr char kManager[] = "KAVOMDManager";

}  // namespace field

// How the content-extraction daemon is reached, and the keys of the options it takes.
namespace extraction {

inline constexpr FixedPath kPidFile("/var/run/kavocontentextractd.pid");
inline constexpr FixedPath kSharedMemory("/tmp/kavoce_shm");
inline constexpr char kService[] = "kavocontentextractd";

inline constexpr char kOptionCfg[] = "cfg";
inline constexpr char kOptionPath[] = "path";
inline constexpr char kOptionNeedMeta[] = "need_meta";
inline constexpr char kOptionPseudoPath[] = "pseudo_path";
inline constexpr char kOptionCodepage[] = "codepage";

}  // namespace extraction
}  // namespace vexlo::fileindex::elastic

#endif  // FILEINDEX_ELASTIC_CONTROL_SCHEMA_H_
