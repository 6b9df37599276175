// Texts as the database keeps them: packed where that makes them shorter. Pure; any thread.
#ifndef DAEMONS_KAVOELASTICD_PACK_H_
#define DAEMONS_KAVOELASTICD_PACK_H_

#include <string>
#include <string_view>

namespace vexlo::elasticd {

// One byte that says which form it is, and the text, or its Zstandard frame with its length.
std::string Pack(std::string_view text);

// The text that Pack() was given. Throws Failure kIndexDamaged for what is none of its answers,
// before memory is taken for a length that cannot be.
std::string Unpack(std::string_view packed);

}  // namespace vexlo::elasticd

#endif  // DAEMONS_KAVOELASTICD_PACK_H_
