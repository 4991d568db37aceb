// What this server speaks HTTP with (http/), by the names that its code uses.
#pragma once

#include "http/Http.h"

namespace kyt::devserver {

using http::Answer;
using http::findHeader;
using http::HttpHandler;
using http::Reply;
using http::Request;
using http::SteadyTime;
using http::Wait;
using http::WaitFor;

}  // namespace kyt::devserver
