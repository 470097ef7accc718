#include "Movie.h"

#include "MovieWriter.h"

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <memory>

namespace moviekit {

namespace {

class VectorSink : public Sink {
public:
    Bytes Take() { return std::move(m_bytes); }

private:
    bool Store(const uint8_t* data, size_t size) override
    {
        m_bytes.insert(m_bytes.end(), data, data + size);
        return true;
    }
    Bytes m_bytes;
};

class FileSink : public Sink {
public:
    explicit FileSink(const std::string& path) : m_file(std::fopen(path.c_str(), "wb"), &std::fclose)
    {
        if (m_file) {
            std::setvbuf(m_file.get(), nullptr, _IOFBF, 1 << 20);
        }
    }
    bool IsOpen() const { return m_file != nullptr; }
    bool Close() { return std::fclose(m_file.release()) == 0; }

private:
    bool Store(const uint8_t* data, size_t size) override
    {
        return std::fwrite(data, 1, size, m_file.get()) == size;
    }

    std::unique_ptr<std::FILE, int (*)(std::FILE*)> m_file;
};

}  // namespace

bool WriteMovie(const std::string& path, const MovieRecipe& recipe, MovieLayout* layout, std::string* error)
{
    FileSink sink(path);
    if (!sink.IsOpen()) {
        if (error != nullptr) {
            *error = "cannot create " + path + ": " + std::strerror(errno);
        }
        return false;
    }
    const bool written = WriteMovieTo(sink, recipe, layout, error);
    if (!sink.Close() && written) {
        if (error != nullptr) {
            *error = "cannot write " + path + ": " + std::strerror(errno);
        }
        return false;
    }
    return written;
}

Bytes BuildMovie(const MovieRecipe& recipe, MovieLayout* layout, std::string* error)
{
    VectorSink sink;
    if (!WriteMovieTo(sink, recipe, layout, error)) {
        return {};
    }
    return sink.Take();
}

}  // namespace moviekit
