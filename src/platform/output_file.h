// Files that a run writes its documents to.

#pragma once

#include <memory>
#include <string>
#include <string_view>

namespace tally::platform {

/// One document that is being written. Nothing is buffered. Used by one thread at a time.
class OutputFile {
  public:
    /// Creates the file of `path`, or empties the one that is there. Where that is the file to which standard
    /// output goes, nothing is emptied: the document is kept aside and follows the standard output at its
    /// end, so that neither tears the other. A FIFO is waited for until somebody reads it.
    /// @return null, with errno, when that cannot be done.
    static std::unique_ptr<OutputFile> open(const std::string& path);
    /// Closes without a word.
    virtual ~OutputFile() = default;

    /// Appends `bytes`. Where not all of them find room, none are left in a regular file, and nothing more is
    /// written.
    virtual void write(std::string_view bytes) = 0;
    /// Ends the document; nothing may follow. @return 0, or the errno of the first bytes that were lost.
    virtual int close() = 0;
    /// Gives the document up: deletes the file, if that is a regular one and its path, which must not be a
    /// link, still leads to the one that open() made.
    virtual void discard() = 0;
};

/// Whether two paths lead to one existing file in which two documents would spoil each other. A device takes
/// both.
bool isOneFile(const std::string& a, const std::string& b);

} // namespace tally::platform
