// Power spectra of consecutive analysis frames, one row per frame, in storage reserved once.
#pragma once

#include <algorithm>
#include <cstddef>
#include <vector>

namespace ovix {

class SpectralFrames {
public:
    SpectralFrames(size_t maxRows, size_t bins) : m_bins(bins), m_maxRows(maxRows), m_values(maxRows * bins) {}

    size_t Bins() const { return m_bins; }
    size_t Rows() const { return m_rows; }
    size_t MaxRows() const { return m_maxRows; }
    void Clear() { m_rows = 0; }
    // A new zeroed row at the end; nullptr when the storage is full.
    float* AddRow()
    {
        if (m_rows == m_maxRows) {
            return nullptr;
        }
        float* row = Row(m_rows++);
        std::fill_n(row, m_bins, 0.0f);
        return row;
    }
    float* Row(size_t row) { return m_values.data() + row * m_bins; }
    const float* Row(size_t row) const { return m_values.data() + row * m_bins; }

private:
    size_t m_bins;
    size_t m_maxRows;
    size_t m_rows = 0;
    std::vector<float> m_values;
};

}  // namespace ovix
