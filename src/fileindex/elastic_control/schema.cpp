#include "fileindex/elastic_control/schema.h"

namespace vexlo::fileindex::elastic {

const char kMappingsText[] = R"({
  "property_id": "KAVOMDPath",
  "default": {"type": "string", "analyzer": "kavostandard", "required": false, "stored": true, "_all": true},
  "properties": {
    "KAVOMDPath": {"analyzer": "keyword", "required": true, "_all": false},

    "KAVOMDFSName": {"analyzer": "keyword", "_all": false},
    "KAVOMDPrivilege": {"analyzer": "keyword", "_all": false},
    "KAVOMDOwnerUserID": {"analyzer": "keyword", "_all": false},
    "KAVOMDOwnerGroupID": {"analyzer": "keyword", "_all": false},
    "KAVOMDParent": {"analyzer": "keyword", "_all": false},
    "KAVOMDExtension": {"analyzer": "keyword", "_all": false},

    "KAVOMDIsDir": {"type": "bool", "_all": false},
    "KAVOMDIsEncrypted": {"type": "bool", "_all": false},

    "KAVOMDFSSize": {"type": "int"},
    "KAVOMDFSContentChangeDate": {"type": "int"},
    "KAVOMDAttributeChangeDate": {"type": "int"},
    "KAVOMDFSCreationDate": {"type": "int"},
    "KAVOMDContentModificationDate": {"type": "int"},
    "KAVOMDLastUsedDate": {"type": "int"},
    "KAVOMDContentCreationDate": {"type": "int"},
    "KAVOMDAudioTrackNumber": {"type": "int"},
    "KAVOMDRecordingYear": {"type": "int"},
    "KAVOMDAudioBitRate": {"type": "int"},
    "KAVOMDTotalBitRate": {"type": "int"},
    "KAVOMDVideoBitRate": {"type": "int"},
    "KAVOMDAudioSampleRate": {"type": "int"},
    "KAVOMDAudioChannelCount": {"type": "int"},
    "KAVOMDISOSpeed": {"type": "int"},
    "KAVOMDResolutionWidthDPI": {"type": "int"},
    "KAVOMDResolutionHeightDPI": {"type": "int"},
    "KAVOMDFinderLabel": {"type": "int"},
    "KAVOMDFinderOpenDate": {"type": "int"},
    "KAVOMDLogicalSize": {"type": "int"},
    "KAVOMDPhysicalSize": {"type": "int"},
    "KAVOMDDateAdded": {"type": "int"},

    "KAVOMDAuthors": {"type": "text", "analyzer": "white space"},
    "KAVOMDCreator": {"type": "text", "analyzer": "white space"},
    "KAVOMDComposer": {"type": "text", "analyzer": "white space"},
    "KAVOMDCodecs": {"type": "text", "analyzer": "white space"},
    "KAVOMDAcquisitionMake": {"type": "text", "analyzer": "white space"},
    "KAVOMDAcquisitionModel": {"type": "text", "analyzer": "white space"},
    "KAVOMDSpotlightBoost": {"type": "text", "analyzer": "white space"},

    "KAVOMDTitle": {"type": "text"},
    "KAVOMDAlbum": {"type": "text"},
    "KAVOMDMusicalGenre": {"type": "text"},
    "KAVOMDComment": {"type": "text"},
    "KAVOMDDescription": {"type": "text"},
    "KAVOMDTextContent": {"type": "text"},
    "_KAVOMDUserTags": {"type": "text"},

    "KAVOMDIdentifier": {"type": "text", "analyzer": "keyword", "_all": false},

    "KAVOMDDurationSecond": {"type": "double"},

    "KAVOMDExposureTimeString": {"analyzer": "keyword"},
    "KAVOMDAperture": {"analyzer": "keyword"},
    "KAVOMDMediaTypes": {"analyzer": "keyword"},
    "KAVOMDGroupId": {"analyzer": "keyword"},
    "KAVOMDStarRating": {"analyzer": "keyword"},

    "KAVOMDKeywords": {},

    "KAVOMDSearchFileName": {"type": "text", "analyzer": "white space", "preprocess": ["tolower", "ngram"]},

    "KAVOMDSearchAncestor": {"type": "text", "analyzer": "white space escaped", "preprocess": ["list_ancestor"], "_all": false}
  }
})";

}  // namespace vexlo::fileindex::elastic
