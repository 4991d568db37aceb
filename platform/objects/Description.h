// Texts with objects in them, as people read them. Pure; any thread. description() of one object is in Value.h.
#pragma once

#include <initializer_list>
#include <string>

#include "platform/objects/Value.h"

namespace kyt {

// Fills a "%@" template: every conversion, "%@", "%s", "%u" or another (its flags and width are ignored),
// takes the next object's description; a missing object prints as "(null)"; "%%" is a percent sign.
[[nodiscard]] std::string formatObjects(const char* format, std::initializer_list<Value> objects);
void appendObjects(std::string& out, const char* format, std::initializer_list<Value> objects);

}  // namespace kyt
