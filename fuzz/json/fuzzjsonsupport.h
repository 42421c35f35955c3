// What both JSON fuzz targets share: the input as a terminated text with nothing after
// the terminator (so AddressSanitizer sees any read past it), and the checks of a tree.
#pragma once

#include "lib/jsonvalue.h"

#include <cstddef>
#include <cstdint>
#include <memory>

// A heap copy of the input with a terminator and nothing behind it.
std::unique_ptr<char[]> FuzzJsonTerminatedCopy(const uint8_t *pbData, size_t cbData);

// Stops the run when the reader's end lies outside [szText, its terminator].
void FuzzJsonCheckEnd(const char *szText, const char *pszEnd);

// Looks up every member of an object root the way the callers do (text, number, a name
// they know), and writes the tree.
void FuzzJsonUseTree(const JsonValue &root);
