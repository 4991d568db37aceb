// Texts that cross the server's borders (http/Text.h), by the names that its code uses.
#pragma once

#include "http/Text.h"

namespace kyt::devserver {

using http::base64;
using http::bytesFromHex;
using http::equalIgnoringCase;
using http::httpDate;
using http::parseInteger;
using http::parseNumber;
using http::printable;
using http::timeNow;
using http::validText;

}  // namespace kyt::devserver
