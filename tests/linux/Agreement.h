// Whether the documents of one run say the same.

#pragma once

#include <cstddef>
#include <string>
#include <vector>

namespace tally::test {

std::string contentsOf(const std::string& path);

/// Compares every figure of a report that -f bytes -w -v printed with those of its JSON document, and those
/// of its performance data with that. A difference fails the test. @return how many reports there are.
std::size_t expectAgreement(const std::string& text, const std::string& json, const std::string& benchlog);

/// Checks JSON files against the schema of the documentation.
void expectValid(const std::vector<std::string>& paths);

} // namespace tally::test
