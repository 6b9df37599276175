// The fields that a search knows by their meaning.
#ifndef DAEMONS_KAVOELASTICD_FIELDS_H_
#define DAEMONS_KAVOELASTICD_FIELDS_H_

namespace vexlo::elasticd {

constexpr char kExtensionField[] = "KAVOMDExtension";
constexpr char kSizeField[] = "KAVOMDFSSize";
constexpr char kModifiedField[] = "KAVOMDFSContentChangeDate";
constexpr char kIsDirField[] = "KAVOMDIsDir";
// What the index daemon knew of the file: {"ctime":NANOSECONDS, ..}.
constexpr char kStampField[] = "FileIndexStamp";

}  // namespace vexlo::elasticd

#endif  // DAEMONS_KAVOELASTICD_FIELDS_H_
