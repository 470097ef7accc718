// Per-bin quantiles over a run of spectral rows, several at once. The rows are gathered a few
// bins at a time into contiguous columns, so that each selection runs in cache instead of
// striding through the whole run once per bin and per quantile.
#pragma once

#include "SpectralFrames.h"

#include <cstddef>
#include <span>
#include <vector>

namespace ovix {

class ColumnQuantiles {
public:
    ColumnQuantiles(size_t maxRows, size_t bins);

    // For every bin, quantile `quantiles[i]` (ascending, in [0, 1]) of rows [from, to) taken
    // every `stride` rows, into `outs[i]`; 0 when there are no rows.
    void Compute(const SpectralFrames& frames, size_t from, size_t to, size_t stride, std::span<const double> quantiles,
                 std::span<std::vector<float>* const> outs);

private:
    static constexpr size_t kTile = 16;  // bins gathered at once

    size_t m_maxRows;
    size_t m_bins;
    std::vector<float> m_columns;  // kTile columns of up to m_maxRows values
};

}  // namespace ovix
