// The interfaces' descriptions, built in.
#pragma once

namespace kyt {

[[nodiscard]] const char* interfaceDescription();       // docs/com.vantu.kytreportingd.xml
[[nodiscard]] const char* administrationDescription();  // docs/com.vantu.kytreportingd.Administration.xml

}  // namespace kyt
