// The dictionaries and arrays of the C interface: the library's own, each in a structure that C knows by name alone.
#pragma once

#include "kytreporting/kytreporting.h"
#include "platform/objects/Value.h"

struct kyt_dictionary {
  kyt::Dictionary value;
};

struct kyt_array {
  kyt::Array value;
};
