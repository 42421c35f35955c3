// Strict check of one JSON text (RFC 8259) in valid UTF-8 (RFC 3629), used where the service
// must not pass on a client's bytes unless they are JSON. Platform-free, so it also builds
// natively for fuzzing. One pass, no recursion: the time is linear in the length and the
// memory in the nesting depth, whatever the input.
#pragma once

#include <cstddef>
#include <string_view>

// True when the bytes are exactly one JSON value with nothing but JSON white space around
// it. Rejected besides what the grammar rejects: malformed or overlong UTF-8, encoded
// surrogates and code points past U+10FFFF, and \u escapes that do not form valid UTF-16
// (a high surrogate not followed by a low one, a lone low surrogate). A zero byte is
// never part of a JSON text.
bool JsonValidateText(std::string_view text);
