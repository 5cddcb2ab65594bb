#pragma once

#include <cstdio>
#include <cstdlib>
#include <string>

// Everything a formatter writes to a memory stream; take() returns what came
// since the last take().
class HTOutputCapture {
public:
    HTOutputCapture() : file_(open_memstream(&data_, &size_)) {}
    ~HTOutputCapture()
    {
        std::fclose(file_);
        std::free(data_);
    }
    HTOutputCapture(const HTOutputCapture&) = delete;
    HTOutputCapture& operator=(const HTOutputCapture&) = delete;

    FILE* file() const { return file_; }
    std::string take()
    {
        std::fflush(file_);
        std::string text(data_ + taken_, size_ - taken_);
        taken_ = size_;
        return text;
    }

private:
    char* data_ = nullptr;
    size_t size_ = 0;
    FILE* file_;
    size_t taken_ = 0;
};
