// SdBusCodec: conversion between BusValue lists and sdbus-c++ messages.
// Private to the bus transport (it exposes sdbus-c++ types); the rest of the
// tree uses BusValue only. Stateless; safe from any thread on messages the
// caller owns.
#pragma once

#include <sdbus-c++/Message.h>

#include <string_view>

#include "platform/Error.h"
#include "platform/dbus/BusValue.h"

namespace platform::sdbuscodec {

// Appends `values` to `message`.
void appendValues(sdbus::Message& message, const BusValues& values);

// Reads values of `signature` (a supported signature) from the current
// position of `message`. Fails when the body does not hold them.
Result<BusValues> readValues(sdbus::Message& message, std::string_view signature);

}  // namespace platform::sdbuscodec
