// What the search engine is told about a share's documents: the names of their fields, and how each
// field is stored and searched.
#ifndef FILEINDEX_ELASTIC_CONTROL_SCHEMA_H_
#define FILEINDEX_ELASTIC_CONTROL_SCHEMA_H_

#include "fileindex/paths.h"

namespace vexlo::fileindex::elastic {

// The mappings document as JSON text; GetFileIndexMappings() hands it out parsed, which is the way
// for programs: the text itself is not exported.
//
// "property_id" names the field whose value identifies a document, "default" the attributes of
// every field that "properties" does not list, "properties" what is different for those it does.
// The path is kept out of the catch-all search; a file name is searched by its lower-cased n-gram
// copy, and a folder by the list of ancestors that the engine makes of a parent path.
extern const char kMappingsText[];

// The metadata fields of a document. Each name is a key of documents that are stored already, so
// every spelling stays, irregular ones included. The mappings know two of the three fields with an
// underscore, the Finder label and the group id, without it. The constants bear the fields' own
// names, less that underscore, which C++ keeps for itself.
namespace field {

// NOLINTBEGIN(readability-identifier-naming)
// Fields, as documents bear them.
inline constexpr char KAVOMDAttributeChangeDate[] = "KAVOMDAttributeChangeDate";
inline constexpr char KAVOMDAudiences[] = "KAVOMDAudiences";
inline constexpr char KAVOMDAuthors[] = "KAVOMDAuthors";
inline constexpr char KAVOMDAuthorAddresses[] = "KAVOMDAuthorAddresses";
inline constexpr char KAVOMDCity[] = "KAVOMDCity";
inline constexpr char KAVOMDComment[] = "KAVOMDComment";
inline constexpr char KAVOMDContactKeywords[] = "KAVOMDContactKeywords";
inline constexpr char KAVOMDContentCreationDate[] = "KAVOMDContentCreationDate";
inline constexpr char KAVOMDContentModificationDate[] = "KAVOMDContentModificationDate";
inline constexpr char KAVOMDContentType[] = "KAVOMDContentType";
inline constexpr char KAVOMDContentTypeTree[] = "KAVOMDContentTypeTree";
inline constexpr char KAVOMDContributors[] = "KAVOMDContributors";
inline constexpr char KAVOMDCopyright[] = "KAVOMDCopyright";
inline constexpr char KAVOMDCountry[] = "KAVOMDCountry";
inline constexpr char KAVOMDCoverage[] = "KAVOMDCoverage";
inline constexpr char KAVOMDCreator[] = "KAVOMDCreator";
inline constexpr char KAVOMDDescription[] = "KAVOMDDescription";
inline constexpr char KAVOMDDisplayName[] = "KAVOMDDisplayName";
inline constexpr char KAVOMDDueDate[] = "KAVOMDDueDate";
inline constexpr char KAVOMDDurationSecond[] = "KAVOMDDurationSecond";
inline constexpr char KAVOMDEmailAddresses[] = "KAVOMDEmailAddresses";
inline constexpr char KAVOMDEncodingApplications[] = "KAVOMDEncodingApplications";
inline constexpr char KAVOMDFinderComment[] = "KAVOMDFinderComment";
inline constexpr char KAVOMDFonts[] = "KAVOMDFonts";
inline constexpr char KAVOMDHeadline[] = "KAVOMDHeadline";
inline constexpr char KAVOMDIdentifier[] = "KAVOMDIdentifier";
inline constexpr char KAVOMDInstantMessageAddresses[] = "KAVOMDInstantMessageAddresses";
inline constexpr char KAVOMDInstructions[] = "KAVOMDInstructions";
inline constexpr char KAVOMDKeywords[] = "KAVOMDKeywords";
inline constexpr char KAVOMDKind[] = "KAVOMDKind";
inline constexpr char KAVOMDLanguages[] = "KAVOMDLanguages";
inline constexpr char KAVOMDLastUsedDate[] = "KAVOMDLastUsedDate";
inline constexpr char KAVOMDNumberOfPages[] = "KAVOMDNumberOfPages";
inline constexpr char KAVOMDNamedLocation[] = "KAVOMDNamedLocation";
inline constexpr char KAVOMDOrganizations[] = "KAVOMDOrganizations";
inline constexpr char KAVOMDPageHeight[] = "KAVOMDPageHeight";
inline constexpr char KAVOMDPageWidth[] = "KAVOMDPageWidth";
inline constexpr char KAVOMDParticipants[] = "KAVOMDParticipants";
inline constexpr char KAVOMDPhoneNumbers[] = "KAVOMDPhoneNumbers";
inline constexpr char KAVOMDProjects[] = "KAVOMDProjects";
inline constexpr char KAVOMDPublishers[] = "KAVOMDPublishers";
inline constexpr char KAVOMDRecipients[] = "KAVOMDRecipients";
inline constexpr char KAVOMDRecipientAddresses[] = "KAVOMDRecipientAddresses";
inline constexpr char KAVOMDRights[] = "KAVOMDRights";
inline constexpr char KAVOMDSecurityMethod[] = "KAVOMDSecurityMethod";
inline constexpr char KAVOMDStarRating[] = "KAVOMDStarRating";
inline constexpr char KAVOStateOrProvince[] = "KAVOStateOrProvince";
inline constexpr char KAVOMDTextContent[] = "KAVOMDTextContent";
inline constexpr char KAVOMDTitle[] = "KAVOMDTitle";
inline constexpr char KAVOMDVersion[] = "KAVOMDVersion";
inline constexpr char KAVOMDWhereFroms[] = "KAVOMDWhereFroms";
inline constexpr char KAVOMDAcquisitionMake[] = "KAVOMDAcquisitionMake";
inline constexpr char KAVOMDAcquisitionModel[] = "KAVOMDAcquisitionModel";
inline constexpr char KAVOMDAlbum[] = "KAVOMDAlbum";
inline constexpr char KAVOMDAperture[] = "KAVOMDAperture";
inline constexpr char KAVOMDBitsPerSample[] = "KAVOMDBitsPerSample";
inline constexpr char KAVOMDColorSpace[] = "KAVOMDColorSpace";
inline constexpr char KAVOMDEXIFVersion[] = "KAVOMDEXIFVersion";
inline constexpr char KAVOMDExposureMode[] = "KAVOMDExposureMode";
inline constexpr char KAVOMDExposureProgram[] = "KAVOMDExposureProgram";
inline constexpr char KAVOMDExposureTimeSeconds[] = "KAVOMDExposureTimeSeconds";
inline constexpr char KAVOMDExposureTimeString[] = "KAVOMDExposureTimeString";
inline constexpr char KAVOMDFNumber[] = "KAVOMDFNumber";
inline constexpr char KAVOMDFlashOnOff[] = "KAVOMDFlashOnOff";
inline constexpr char KAVOMDFocalLength[] = "KAVOMDFocalLength";
inline constexpr char KAVOMDHasAlphaChannel[] = "KAVOMDHasAlphaChannel";
inline constexpr char KAVOMDISOSpeed[] = "KAVOMDISOSpeed";
inline constexpr char KAVOMDLayerNames[] = "KAVOMDLayerNames";
inline constexpr char KAVOMDMaxAperture[] = "KAVOMDMaxAperture";
inline constexpr char KAVOMDMeteringMode[] = "KAVOMDMeteringMode";
inline constexpr char KAVOMDOrientation[] = "KAVOMDOrientation";
inline constexpr char KAVOMDPixelHeight[] = "KAVOMDPixelHeight";
inline constexpr char KAVOMDPixelWidth[] = "KAVOMDPixelWidth";
inline constexpr char KAVOMDPixelCount[] = "KAVOMDPixelCount";
inline constexpr char KAVOMDProfileName[] = "KAVOMDProfileName";
inline constexpr char KAVOMDRedEyeOnOff[] = "KAVOMDRedEyeOnOff";
inline constexpr char KAVOMDResolutionHeightDPI[] = "KAVOMDResolutionHeightDPI";
inline constexpr char KAVOMDResolutionWidthDPI[] = "KAVOMDResolutionWidthDPI";
inline constexpr char KAVOMDWhiteBalance[] = "KAVOMDWhiteBalance";
inline constexpr char KAVOMDAudioBitRate[] = "KAVOMDAudioBitRate";
inline constexpr char KAVOMDCodecs[] = "KAVOMDCodecs";
inline constexpr char KAVOMDDeliveryType[] = "KAVOMDDeliveryType";
inline constexpr char KAVOMDMediaTypes[] = "KAVOMDMediaTypes";
inline constexpr char KAVOMDStreamable[] = "KAVOMDStreamable";
inline constexpr char KAVOMDTotalBitRate[] = "KAVOMDTotalBitRate";
inline constexpr char KAVOMDVideoBitRate[] = "KAVOMDVideoBitRate";
inline constexpr char KAVOMDAppleLoopDescriptors[] = "KAVOMDAppleLoopDescriptors";
inline constexpr char KAVOMDAppleLoopsKeyFilterType[] = "KAVOMDAppleLoopsKeyFilterType";
inline constexpr char KAVOMDAppleLoopsLoopMode[] = "KAVOMDAppleLoopsLoopMode";
inline constexpr char KAVOMDAppleLoopsRootKey[] = "KAVOMDAppleLoopsRootKey";
inline constexpr char KAVOMDAudioChannelCount[] = "KAVOMDAudioChannelCount";
inline constexpr char KAVOMDAudioEncodingApplication[] = "KAVOMDAudioEncodingApplication";
inline constexpr char KAVOMDAudioSampleRate[] = "KAVOMDAudioSampleRate";
inline constexpr char KAVOMDAudioTrackNumber[] = "KAVOMDAudioTrackNumber";
inline constexpr char KAVOMDComposer[] = "KAVOMDComposer";
inline constexpr char KAVOMDGeneralMIDISequence[] = "KAVOMDGeneralMIDISequence";
inline constexpr char KAVOMDKeySignature[] = "KAVOMDKeySignature";
inline constexpr char KAVOMDLyricist[] = "KAVOMDLyricist";
inline constexpr char KAVOMDMusicalGenre[] = "KAVOMDMusicalGenre";
inline constexpr char KAVOMDMusicalInstrumentCategory[] = "KAVOMDMusicalInstrumentCategory";
inline constexpr char KAVOMDMusicalInstrumentName[] = "KAVOMDMusicalInstrumentName";
inline constexpr char KAVOMDRecodingDate[] = "KAVOMDRecodingDate";
inline constexpr char KAVOMDRecordingYear[] = "KAVOMDRecordingYear";
inline constexpr char KAVOMDTempo[] = "KAVOMDTempo";
inline constexpr char KAVOMDTimeSignature[] = "KAVOMDTimeSignature";
inline constexpr char KAVOMDFSContentChangeDate[] = "KAVOMDFSContentChangeDate";
inline constexpr char KAVOMDFSCreationDate[] = "KAVOMDFSCreationDate";
inline constexpr char KAVOMDFSInvisible[] = "KAVOMDFSInvisible";
inline constexpr char KAVOMDFSIsExtensionHidden[] = "KAVOMDFSIsExtensionHidden";
inline constexpr char KAVOMDFSLabel[] = "KAVOMDFSLabel";
inline constexpr char KAVOMDFSName[] = "KAVOMDFSName";
inline constexpr char KAVOMDFSNodeCount[] = "KAVOMDFSNodeCount";
inline constexpr char KAVOMDOwnerGroupID[] = "KAVOMDOwnerGroupID";
inline constexpr char KAVOMDOwnerUserID[] = "KAVOMDOwnerUserID";
inline constexpr char KAVOMDFSSize[] = "KAVOMDFSSize";
inline constexpr char KAVOMDPath[] = "KAVOMDPath";
inline constexpr char KAVOMDUserTags[] = "_KAVOMDUserTags";
inline constexpr char KAVOMDParent[] = "KAVOMDParent";
inline constexpr char KAVOMDSearchFileName[] = "KAVOMDSearchFileName";
inline constexpr char KAVOMDSearchAncestor[] = "KAVOMDSearchAncestor";
inline constexpr char KAVOMDExtension[] = "KAVOMDExtension";
inline constexpr char KAVOMDPrivilege[] = "KAVOMDPrivilege";
inline constexpr char KAVOMDIsDir[] = "KAVOMDIsDir";
inline constexpr char KAVOMDWildcard[] = "KAVOMDWildcard";
inline constexpr char KAVOMDIsEncrypted[] = "KAVOMDIsEncrypted";
inline constexpr char KAVOMDFinderLabel[] = "_KAVOMDFinderLabel";
inline constexpr char KAVOMDGroupId[] = "_KAVOMDGroupId";
inline constexpr char KAVOMDFinderOpenDate[] = "KAVOMDFinderOpenDate";
inline constexpr char KAVOMDLogicalSize[] = "KAVOMDLogicalSize";
inline constexpr char KAVOMDPhysicalSize[] = "KAVOMDPhysicalSize";
inline constexpr char KAVOMDDateAdded[] = "KAVOMDDateAdded";
inline constexpr char KAVOMDPeopleDisplayName[] = "KAVOMDPeopleDisplayName";
inline constexpr char KAVOMDSubject[] = "KAVOMDSubject";
inline constexpr char KAVOMDPageCount[] = "KAVOMDPageCount";
inline constexpr char KAVOMDWordCount[] = "KAVOMDWordCount";
inline constexpr char KAVOMDTemplate[] = "KAVOMDTemplate";
inline constexpr char KAVOMDLicense[] = "KAVOMDLicense";
inline constexpr char KAVOMDCategory[] = "KAVOMDCategory";
inline constexpr char KAVOMDManager[] = "KAVOMDManager";

// NOLINTEND(readability-identifier-naming)

}  // namespace field

// How the content-extraction daemon is reached, and the keys of the options it takes.
namespace extraction {

// Its pid file, the shared memory that it may use, and its service (kavo/service.h).
inline constexpr FixedPath kPidFile("/var/run/kavocontentextractd.pid");
inline constexpr FixedPath kSharedMemory("/tmp/kavoce_shm");
inline constexpr char kService[] = "kavocontentextractd";

// Keys of the options of an extraction library. The library sets "need_meta" alone (see
// kavo/content_extract.h).
inline constexpr char kOptionCfg[] = "cfg";
inline constexpr char kOptionPath[] = "path";
inline constexpr char kOptionNeedMeta[] = "need_meta";
inline constexpr char kOptionPseudoPath[] = "pseudo_path";
inline constexpr char kOptionCodepage[] = "codepage";

}  // namespace extraction
}  // namespace vexlo::fileindex::elastic

#endif  // FILEINDEX_ELASTIC_CONTROL_SCHEMA_H_
