// The probe's output files. Each is opened before the survey starts, so that
// a path that cannot be written is refused before anyone waits for nothing;
// "-" means standard output. A file the probe created and then never wrote
// (the survey did not run) is removed again.
#ifndef QUELTA_PROBE_OUTPUTS_H
#define QUELTA_PROBE_OUTPUTS_H

#include <cstdio>
#include <string>
#include <vector>

namespace qprobe {

class OutputFile {
public:
    OutputFile(std::string what, std::string path) : what_(std::move(what)), path_(std::move(path)) {}
    ~OutputFile();
    OutputFile(const OutputFile&) = delete;
    OutputFile& operator=(const OutputFile&) = delete;

    bool requested() const { return !path_.empty(); }
    bool toStdout() const { return path_ == "-"; }
    const std::string& what() const { return what_; }

    // Opens for writing (truncating); false with a message in `why`.
    bool Open(std::string& why);
    FILE* stream() const { return file_; }
    // Writes the whole text (or only flushes, for a streamed file) and
    // closes; false with a message in `why`.
    bool Finish(const std::string& text, std::string& why);
    // Removes the file when the probe created it and nothing was written.
    void Abandon();
    // Where it went, for a person: the absolute path, or "standard output".
    std::string Where() const;

private:
    std::string what_;
    std::string path_;
    FILE* file_ = nullptr;
    bool created_ = false;
    bool finished_ = false;
};

}  // namespace qprobe

#endif
