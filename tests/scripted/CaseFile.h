// CaseFile: a kernel, runs of the tool on it and what they are to print, as one text file.
//
//   # a comment
//   task 100 server page_table=8K             records of the kernel (KernelFromCase.h)
//     map tag=2 pages=D3C2
//   run -w -p server                          one run: its arguments, its exit status, what it prints
//   status 0
//   stdout
//   ...                                       lines up to "end"; "stdout same": as in the run before
//   end
//   stderr                                    left out: nothing
//   ...
//   end
//   file out.json                             what the run leaves in its folder, as stdout; a line that
//   ...                                       begins with blanks continues the one before, without them;
//   end                                       before the first run: what is there from the start
//   shell COMMAND                             to be run before, in the shell that becomes the tool
//   heapsnap 100                              a run of the other program
//
// Blanks separate words. In a word \x41 is a byte, \s a blank, \n a newline and \\ a backslash.

#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <vector>

namespace tally {

/// One line: a keyword, plain words and key=value pairs. What is taken is gone, so what nobody knows is left.
struct CaseStatement {
    std::string keyword;
    std::vector<std::string> words;
    std::map<std::string, std::string> values;
    std::string place; // file and line, for messages

    std::optional<std::string> text(const std::string& key);
    /// A number, with K or M behind it in units of 1024.
    std::optional<std::uint64_t> number(const std::string& key);
    /// Takes the plain word `word`. @return whether it was there.
    bool flag(const std::string& word);
    /// Throws when something is left that nobody took.
    void requireNothingLeft() const;
};

/// `word` as a number, as in CaseStatement::number. Throws std::invalid_argument.
std::uint64_t caseNumber(const std::string& word);

struct CaseRun {
    std::vector<std::string> arguments;
    bool isHeapsnap = false;
    std::string shell = "true"; // command
    int status = 0;
    std::string standardOutput;
    std::string standardError;
    std::map<std::string, std::string> files; // contents by name
};

struct CaseFile {
    std::vector<CaseStatement> kernel;
    std::map<std::string, std::string> files; // from the start, contents by name
    std::vector<CaseRun> runs;

    /// Reads the file of `path`. Throws std::runtime_error that names the line.
    static CaseFile read(const std::string& path);
};

} // namespace tally
