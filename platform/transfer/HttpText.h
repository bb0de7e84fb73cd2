// Text helpers shared by the S3 request code: case folding, the canonical form of header
// values, and percent-encoding. Pure functions, any thread.
#pragma once

#include <string>
#include <vector>

namespace httptext {

std::string Lower(std::string text);

// Trims blanks and tabs at both ends and folds inner runs of them into one space: the form
// in which SigV4 signs a header value. With `printableOnly`, bytes outside printable ASCII
// become '_' (a line break in a value would add a header of its own).
std::string FoldSpaces(const std::string& value, bool printableOnly);

// Percent-encodes (upper-case hex) every byte for which `keep` is false.
std::string PercentEncode(const std::string& text, bool (*keep)(unsigned char));

// Replaces every occurrence of each secret of 4 characters or more with "***": for texts from
// a server or a library that are about to be logged.
std::string Redact(std::string text, const std::vector<std::string>& secrets);

}  // namespace httptext
