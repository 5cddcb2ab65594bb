#pragma once

#include <cstdio>
#include <memory>
#include <optional>
#include <string>

// A file the report is written to, whole or not at all. A regular file (or
// one that does not exist yet) is written under a temporary name beside it
// and takes its name only when commit() finds every write done, so that an
// earlier file is never damaged and an interrupted or failed run leaves no
// half file. A device or pipe (/dev/stdout, a FIFO) is written in place.
// Several files may be open at once, from different threads.
class HTOutputFile {
public:
    // Null, with `errorText` set to the reason, when the file cannot be
    // written: its directory is missing or closed to heft, or it is a
    // directory.
    static std::unique_ptr<HTOutputFile> open(const std::string& path, std::string* errorText);
    // Why files cannot be written into `directory`, or nullopt when they
    // can: it is missing, no directory, or closed to heft.
    static std::optional<std::string> directoryProblem(const std::string& directory);
    // Without a commit, the temporary file is removed.
    ~HTOutputFile();
    HTOutputFile(const HTOutputFile&) = delete;
    HTOutputFile& operator=(const HTOutputFile&) = delete;

    std::FILE* stream() const { return stream_; }
    // Closes the file and gives it its name; false, with `errorText` set,
    // when a write, the close or the rename failed (the file is then gone).
    bool commit(std::string* errorText);

private:
    HTOutputFile(std::string path, std::string temporaryPath, std::FILE* stream, int slot);

    std::string path_;
    std::string temporaryPath_;  // empty when written in place
    std::FILE* stream_;
    // Where the temporary file's name waits for a fatal signal; -1 for none.
    int slot_;
};
