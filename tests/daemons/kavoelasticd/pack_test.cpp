#include "daemons/kavoelasticd/pack.h"

#include <gtest/gtest.h>

#include <random>
#include <string>

#include "daemons/kavoelasticd/failure.h"

namespace {

using namespace std::string_literals;
using vexlo::elasticd::Pack;
using vexlo::elasticd::Unpack;

TEST(Pack, GivesTheTextBack) {
  std::mt19937_64 random(1);
  std::string noise(100000, '\0');
  for (char& c : noise) {
    c = static_cast<char>(random());
  }
  for (const std::string& text : {""s, "a\0\xff\xfe"s, noise}) {
    const std::string packed = Pack(text);
    EXPECT_LE(packed.size(), text.size() + 1);
    EXPECT_EQ(Unpack(packed), text) << text.size();
  }
  const std::string same(1000000, 'x');
  EXPECT_LE(Pack(same).size(), 1000U);
  EXPECT_EQ(Unpack(Pack(same)), same);
}

TEST(Pack, WhatIsDamagedIsRefused) {
  const std::string good = Pack(std::string(5000, 'x'));
  const struct {
    const char* name;
    std::string packed;
  } rows[] = {
      {"nothing", ""},
      {"another form", "\2" + good.substr(1)},
      {"cut short", good.substr(0, good.size() - 1)},
      // The magic number, a descriptor with eight bytes of length in one segment, and the length.
      {"a length that cannot be", "\1\x28\xb5\x2f\xfd\xe0"s + std::string(8, '\x7f')},
      {"more behind it", good + "x"},
  };
  for (const auto& row : rows) {
    try {
      Unpack(row.packed);
      ADD_FAILURE() << row.name;
    } catch (const vexlo::elasticd::Failure& failure) {
      EXPECT_EQ(failure.GetCode(), vexlo::elasticd::Code::kIndexDamaged) << row.name;
    }
  }
}

}  // namespace
