// What a run writes to: its documents' files, and standard output.

#pragma once

#include <atomic>
#include <cstdint>
#include <cstdio>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

namespace tally::platform {

/// One document that is being written. Nothing is buffered. Used by one thread at a time.
class OutputFile {
  public:
    /// Creates the file of `path`, or opens the one that is there, which is emptied by the first bytes that
    /// are written. Where that is the file to which standard output goes, nothing is emptied: the document is
    /// kept aside and follows the standard output at its end, so that neither tears the other. A FIFO is
    /// waited for until somebody reads it.
    /// @return null, with errno, when that cannot be done.
    static std::unique_ptr<OutputFile> open(const std::string& path);
    /// Closes without a word.
    virtual ~OutputFile() = default;

    /// Appends `bytes`. Where not all of them find room, none are left in a regular file, and nothing more is
    /// written.
    virtual void write(std::string_view bytes) = 0;
    /// Ends the document; nothing may follow. @return 0, or the errno of the first bytes that were lost.
    virtual int close() = 0;
    /// From now on, a document that open() has found and that was not emptied yet stays as it is: what is
    /// written instead is dropped.
    virtual void spareEarlier() {}
    /// Gives the document up: deletes the file, if open() made it and it still stands in its place.
    virtual void discard() = 0;
};

/// Standard output as a stream of text, which never fails: what gets lost is told by error(). Used by one
/// thread at a time, but for stopWaiting().
class StandardOutput {
  public:
    StandardOutput();
    ~StandardOutput();
    StandardOutput(const StandardOutput&) = delete;
    StandardOutput& operator=(const StandardOutput&) = delete;

    std::FILE* stream() const { return stream_; }
    /// From now on text is given up once nobody has taken any for a second. From any thread.
    void stopWaiting() { waits_ = false; }
    /// The errno of the first bytes that were lost, of those flushed; 0 when there are none, or when whoever
    /// reads has left or was not waited for.
    int error() const;

  private:
    static ssize_t write(void* self, const char* bytes, std::size_t size);
    bool awaitReader() const;

    std::atomic<bool> waits_ = true;
    std::size_t mostAtOnce_; // bytes that a ready output takes without waiting
    int error_ = 0;
    std::FILE* stream_;
};

/// Whether two paths lead to one existing file in which two documents would spoil each other. A device takes
/// both.
bool isOneFile(const std::string& a, const std::string& b);

/// By what a file is known in the memory of processes.
struct FileInMemory {
    std::string path; // that mappings of it show, unless it was opened by another link
    std::uint64_t device = 0;
    std::uint64_t inode = 0;
    std::uint64_t object = 0; // the VM object behind them, once they are touched
};
/// Absent where `path` leads to no regular file.
std::optional<FileInMemory> fileInMemory(const std::string& path);
/// Whether process `pid` maps the file now, touched or not. False where its mappings cannot be read.
bool mapsFile(std::int32_t pid, const FileInMemory& file);

} // namespace tally::platform
