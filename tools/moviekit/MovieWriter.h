// Lays a planned movie out and streams it atom by atom into a byte sink, filling
// MovieLayout with where everything went.
#pragma once

#include "Movie.h"

namespace moviekit {

// Where the bytes go; counts them so the writer can check the size it promised.
class Sink {
public:
    virtual ~Sink() = default;
    bool Write(const Bytes& bytes)
    {
        m_written += bytes.size();
        return bytes.empty() || Store(bytes.data(), bytes.size());
    }
    uint64_t Written() const { return m_written; }

private:
    virtual bool Store(const uint8_t* data, size_t size) = 0;
    uint64_t m_written = 0;
};

bool WriteMovieTo(Sink& sink, const MovieRecipe& recipe, MovieLayout* layout, std::string* error);

}  // namespace moviekit
