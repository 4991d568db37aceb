// The text of docs/com.vantu.kytreportingd.xml, built in.
#pragma once

namespace kyt {

[[nodiscard]] const char* interfaceDescription();

}  // namespace kyt
