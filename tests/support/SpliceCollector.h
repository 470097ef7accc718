// What the AAC splicer hands its writer, collected: the source's packets where the sound came
// back unchanged, re-encoded ones around the changes, in order.
#pragma once

#include <cstdint>
#include <vector>

#include "codec/CTqovixAacSplicer.h"

namespace testsupport {

class SpliceCollector : public CTqovixAacSplicer::Sink {
public:
    using Packets = std::vector<std::vector<uint8_t>>;
    explicit SpliceCollector(const Packets& source) : m_source(source) {}
    eTqovixErrorCode CarrySourcePackets(uint64_t count) override
    {
        for (uint64_t k = 0; k < count && written.size() < m_source.size(); ++k) {
            written.push_back(m_source[written.size()]);
            carried.push_back(true);
        }
        return eTqovixSuccess;
    }
    eTqovixErrorCode WriteEncodedPacket(const uint8_t* packet, uint32_t size) override
    {
        written.emplace_back(packet, packet + size);
        carried.push_back(false);
        return eTqovixSuccess;
    }
    eTqovixErrorCode ReadSourcePacket(uint64_t index, std::vector<uint8_t>& packet) override
    {
        packet = m_source.at(index);
        return eTqovixSuccess;
    }
    Packets written;
    std::vector<bool> carried;

private:
    const Packets& m_source;
};

}  // namespace testsupport
