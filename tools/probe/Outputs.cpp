#include "probe/Outputs.h"

#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>

namespace qprobe {

OutputFile::~OutputFile() {
    if (file_ != nullptr && !toStdout()) std::fclose(file_);
}

bool OutputFile::Open(std::string& why) {
    if (toStdout()) {
        file_ = stdout;
        return true;
    }
    struct stat st{};
    const bool existed = stat(path_.c_str(), &st) == 0;
    if (existed && S_ISDIR(st.st_mode)) {
        why = "it is a directory";
        return false;
    }
    file_ = std::fopen(path_.c_str(), "w");
    if (file_ == nullptr) {
        why = std::strerror(errno);
        return false;
    }
    created_ = !existed;
    return true;
}

bool OutputFile::Finish(const std::string& text, std::string& why) {
    if (file_ == nullptr) return false;
    errno = 0;
    bool ok = text.empty() || std::fwrite(text.data(), 1, text.size(), file_) == text.size();
    ok = std::fflush(file_) == 0 && ok && !std::ferror(file_);
    if (!toStdout()) {
        ok = std::fclose(file_) == 0 && ok;
        file_ = nullptr;
    }
    finished_ = true;
    if (!ok) why = errno != 0 ? std::strerror(errno) : "write error";
    return ok;
}

void OutputFile::Abandon() {
    if (toStdout() || file_ == nullptr) return;
    std::fclose(file_);
    file_ = nullptr;
    if (created_ && !finished_) unlink(path_.c_str());
}

std::string OutputFile::Where() const {
    if (toStdout()) return "standard output";
    char resolved[PATH_MAX];
    if (realpath(path_.c_str(), resolved) != nullptr) return resolved;
    return path_;
}

}  // namespace qprobe
