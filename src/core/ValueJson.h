// ValueJson: the typed JSON form of a Value, in which berthctl takes raw
// requests ("send") and prints replies ("--json").
//
// Plain JSON maps directly where it cannot be misread:
//
//   JSON                          Value
//   null, true/false              null, bool
//   "text"                        string
//   [ ... ]                       array
//   { ... }                       dictionary
//   integer >= 0                  uint64
//   integer < 0                   int64
//   number with a fraction or an  double (so does an integer outside the
//   exponent                      64-bit ranges)
//
// An object with exactly one member whose name is a kind forces that kind:
//
//   {"uint64": 5}                 uint64; a JSON integer in 0..2^64-1
//   {"int64": 5}                  int64; a JSON integer in -2^63..2^63-1
//   {"double": 5}                 double; any JSON number, or "nan", "inf", "-inf"
//   {"date": 1.5e9}               date, seconds since 1970; same numbers as double
//   {"uuid": "1B4E28BA-..."}      uuid; canonical 8-4-4-4-12 text, either case
//   {"data": "AAEC"}              data; standard base64 with padding
//   {"dictionary": {...}}         a dictionary taken member by member, for a
//                                 dictionary whose only key is a kind name
//
// Such an object with a value of the wrong form is an error, never silently a
// dictionary. Duplicate member names and nesting beyond the wire's depth limit
// are errors too.
//
// Output uses a wrapper only where plain JSON would read back as another kind:
// int64 >= 0 as {"int64": N}; non-finite doubles as {"double": "nan"} etc.;
// every date, uuid and data; and a dictionary whose only key is a kind name as
// {"dictionary": {...}}. Everything else is plain. So any Value converts to
// text and back to an identical Value, except that NaN loses its sign and
// payload, and strings that are not UTF-8 (which the wire never carries) have
// their bad bytes replaced by U+FFFD.
#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "core/Value.h"

namespace berth {

// JSON text of `value`: on one line when `indent` is negative, else
// pretty-printed with that many spaces per level.
std::string valueToJson(const Value& value, int indent = -1);

// Parses JSON text into a Value. On failure returns nullopt and, when `error`
// is given, a one-line reason with the JSON pointer of the offending member,
// e.g. "/Info/Blob/data: invalid base64".
std::optional<Value> valueFromJson(std::string_view text, std::string* error = nullptr);

}  // namespace berth
