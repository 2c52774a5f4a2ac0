#include "scripted/CaseFile.h"

#include <algorithm>
#include <fstream>
#include <regex>
#include <sstream>
#include <stdexcept>

namespace tally {

namespace {

std::string unescaped(const std::string& word) {
    std::string text;
    for (std::size_t i = 0; i < word.size(); ++i) {
        if (word[i] != '\\' || i + 1 == word.size()) {
            text += word[i];
            continue;
        }
        const char letter = word[++i];
        if (letter == 'x') {
            text += static_cast<char>(std::stoi(word.substr(i + 1, 2), nullptr, 16));
            i += 2;
        } else {
            text += letter == 'n' ? '\n' : letter == 's' ? ' ' : letter;
        }
    }
    return text;
}

CaseStatement statementOf(const std::string& line, const std::string& place) {
    CaseStatement statement;
    statement.place = place;
    std::istringstream words(line);
    words >> statement.keyword;
    for (std::string word; words >> word;) {
        const std::size_t equals = word.find('=');
        if (equals == std::string::npos || statement.keyword == "run" || statement.keyword == "heapsnap" ||
            statement.keyword == "shell") {
            statement.words.push_back(unescaped(word));
        } else {
            statement.values[word.substr(0, equals)] = unescaped(word.substr(equals + 1));
        }
    }
    return statement;
}

/// The lines up to one that is "end".
std::string readBlock(std::istream& file, int& lineNumber) {
    std::string block;
    for (std::string line; std::getline(file, line) && ++lineNumber != 0;) {
        if (line == "end") {
            return block;
        }
        block += line + "\n";
    }
    throw std::runtime_error("a block has no end");
}

} // namespace

std::uint64_t caseNumber(const std::string& word) {
    std::size_t length = 0;
    const std::uint64_t value = std::stoull(word, &length, 0);
    const std::string unit = word.substr(length);
    if (unit != "" && unit != "K" && unit != "M") {
        throw std::invalid_argument(word + " is no number");
    }
    return unit == "M" ? value << 20 : unit == "K" ? value << 10 : value;
}

std::optional<std::string> CaseStatement::text(const std::string& key) {
    const auto node = values.extract(key);
    return node.empty() ? std::nullopt : std::optional(node.mapped());
}

std::optional<std::uint64_t> CaseStatement::number(const std::string& key) {
    const std::optional<std::string> word = text(key);
    return word ? std::optional(caseNumber(*word)) : std::nullopt;
}

bool CaseStatement::flag(const std::string& word) { return std::erase(words, word) != 0; }

void CaseStatement::requireNothingLeft() const {
    if (!values.empty() || !words.empty()) {
        throw std::invalid_argument("unknown: " + (values.empty() ? words.front() : values.begin()->first));
    }
}

CaseFile CaseFile::read(const std::string& path) {
    std::ifstream file(path);
    if (!file) {
        throw std::runtime_error(path + " cannot be read");
    }
    CaseFile result;
    int lineNumber = 0;
    for (std::string line; std::getline(file, line);) {
        const std::string place = path + ":" + std::to_string(++lineNumber);
        CaseStatement statement = statementOf(line, place);
        const std::string& keyword = statement.keyword;
        if (keyword.empty() || keyword.front() == '#') {
            continue;
        }
        if (keyword == "run" || keyword == "heapsnap") {
            result.runs.emplace_back().arguments = statement.words;
            result.runs.back().isHeapsnap = keyword == "heapsnap";
        } else if (keyword == "file") {
            auto& files = result.runs.empty() ? result.files : result.runs.back().files;
            files[statement.words.at(0)] =
                std::regex_replace(readBlock(file, lineNumber), std::regex("\n +"), "");
        } else if (result.runs.empty()) {
            result.kernel.push_back(std::move(statement));
        } else if (keyword == "status") {
            result.runs.back().status = std::stoi(statement.words.at(0));
        } else if (keyword == "stdout" && statement.flag("same")) {
            result.runs.back().standardOutput = result.runs.at(result.runs.size() - 2).standardOutput;
        } else if (keyword == "stdout") {
            result.runs.back().standardOutput = readBlock(file, lineNumber);
        } else if (keyword == "stderr") {
            result.runs.back().standardError = readBlock(file, lineNumber);
        } else if (keyword == "shell") {
            result.runs.back().shell = line.substr(keyword.size() + 1);
        } else {
            throw std::runtime_error(place + ": unknown keyword " + keyword);
        }
    }
    return result;
}

} // namespace tally
