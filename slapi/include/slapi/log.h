// The server's debug switch and its numbered messages for the operator.
#pragma once

#include <cstdint>

namespace orv {

// Whether the server's debug output is on.
bool read_ldap_debug();
void set_ldap_debug(bool on);

// Writes a line of debug output with its category; only called while read_ldap_debug() is true.
// Thread-safe.
[[gnu::format(printf, 2, 3)]] void PrintDebug(std::uint32_t category, const char* format, ...);

// Writes message `number` of message set `set` of the catalogue to the server log. `severity` is
// passed as 0. Built-in texts stand in when the catalogue is missing; a catalogue text is used only
// when its conversions are those of the built-in text. Thread-safe.
void PrintMessage(int severity, int set, int number, ...);

// Opens the message catalogue at `path` (null: the environment's NLSPATH and the name "orvd").
// False when there is none; the built-in texts then serve. Call before threads start.
bool open_message_catalogue(const char* path);

// Receives each finished message: `text` without a newline. The server points it at its error log;
// standard error until then.
using MessageSink = void (*)(int severity, int set, int number, const char* text) noexcept;
void set_message_sink(MessageSink sink) noexcept;

}  // namespace orv
