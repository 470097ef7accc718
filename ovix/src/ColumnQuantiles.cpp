#include "ColumnQuantiles.h"

#include <algorithm>

namespace ovix {

ColumnQuantiles::ColumnQuantiles(size_t maxRows, size_t bins)
    : m_maxRows(maxRows), m_bins(bins), m_columns(kTile * maxRows)
{
}

void ColumnQuantiles::Compute(const SpectralFrames& frames, size_t from, size_t to, size_t stride,
                              std::span<const double> quantiles, std::span<std::vector<float>* const> outs)
{
    to = std::min(to, frames.Rows());
    from = std::min(from, to);
    stride = std::max<size_t>(stride, 1);
    const size_t n = std::min((to - from + stride - 1) / stride, m_maxRows);
    for (size_t first = 0; first < m_bins; first += kTile) {
        const size_t width = std::min(kTile, m_bins - first);
        for (size_t i = 0; i < n; ++i) {
            const float* row = frames.Row(from + i * stride) + first;
            for (size_t b = 0; b < width; ++b) {
                m_columns[b * m_maxRows + i] = row[b];
            }
        }
        for (size_t b = 0; b < width; ++b) {
            float* column = m_columns.data() + b * m_maxRows;
            // Each selection leaves what lies above its place for the next, higher one.
            size_t low = 0;
            for (size_t q = 0; q < quantiles.size(); ++q) {
                float value = 0.0f;
                if (n > 0) {
                    const size_t at = std::max(low, std::min(n - 1, static_cast<size_t>(quantiles[q] * static_cast<double>(n))));
                    std::nth_element(column + low, column + at, column + n);
                    value = column[at];
                    low = at;
                }
                (*outs[q])[first + b] = value;
            }
        }
    }
}

}  // namespace ovix
