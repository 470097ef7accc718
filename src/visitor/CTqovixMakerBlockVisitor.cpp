#include "visitor/CTqovixMakerBlockVisitor.h"

#include <cstring>

#include "atom/CTqovixLeafAtom.h"
#include "atom/TqovixEndian.h"
#include "bridge/TqovixAllocation.h"
#include "ovix/Ovix.h"

CTqovixMakerBlockVisitor::CTqovixMakerBlockVisitor(eTqovixAtomType leafType, eTqovixErrorCode emptyAtomCode)
    : CTqovixPathTargetVisitor({TqovixAtom::kMoov, TqovixAtom::kUdta, TqovixAtom::kTCDT, TqovixAtom::kTCDB, leafType}),
      m_emptyAtomCode(emptyAtomCode)
{
}

eTqovixErrorCode CTqovixMakerBlockVisitor::Analyze(const TqovixAtomPath& path, const CTqovixLeafAtom& atom) const
{
    if (!IsTarget(path)) {
        return eTqovixVisitSkip;
    }
    // The block always carries an 8-byte header, even for an atom stored with a
    // 16-byte one; its size field has 32 bits, so larger atoms are refused.
    const uint64_t payloadSize = atom.GetDataSize();
    const uint64_t blockSize = payloadSize + 8;
    if (blockSize > UINT32_MAX || static_cast<uint32_t>(atom.GetSize()) == 0) {
        return m_emptyAtomCode;
    }
    // More than the processing library reads is refused before a byte of it is loaded.
    if (blockSize > kOvixMaxBlockSize) {
        return eTqovixErrorInvalidMovie;
    }
    const uint8_t* payload = atom.GetData();
    if (payload == nullptr && payloadSize != 0) {
        return eTqovixErrorInvalidMovie;
    }
    const eTqovixErrorCode allocated = TqovixAllocate([&] { m_block.assign(static_cast<size_t>(blockSize), 0); });
    if (TqovixFailed(allocated)) {
        return allocated;
    }
    TqovixWriteBE32(m_block.data(), static_cast<uint32_t>(blockSize));
    const uint32_t type = atom.GetType();
    std::memcpy(m_block.data() + 4, &type, 4);
    if (payloadSize != 0) {
        std::memcpy(m_block.data() + 8, payload, static_cast<size_t>(payloadSize));
    }
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixMakerBlockVisitor::Update(const TqovixAtomPath& path, CTqovixLeafAtom& atom) const
{
    if (!IsTarget(path)) {
        return eTqovixVisitSkip;
    }
    if (TqovixFailed(m_setFailure)) {
        return m_setFailure;
    }
    if (m_block.empty()) {
        return eTqovixErrorInternal;
    }
    atom.SetData(m_block.data(), m_block.size());
    return eTqovixSuccess;
}

void CTqovixMakerBlockVisitor::SetBlock(const void* data, uint64_t size)
{
    m_block.clear();
    m_setFailure = eTqovixSuccess;
    if (data == nullptr || size == 0) {
        return;
    }
    const auto* bytes = static_cast<const uint8_t*>(data);
    // A size field of 1 announces the 64-bit size that follows: a 16-byte header.
    const uint64_t headerSize = size >= 4 && TqovixReadBE32(bytes) == 1 ? 16 : 8;
    if (size <= headerSize) {
        return;  // nothing behind the header: an empty block
    }
    m_setFailure = TqovixAllocate([&] { m_block.assign(bytes + headerSize, bytes + size); });
}

CTqovixAFInformationVisitor::CTqovixAFInformationVisitor()
    : CTqovixMakerBlockVisitor(TqovixAtom::kOP01, eTqovixErrorInvalidMovie)
{
}

CTqovixAudioLevelInformationVisitor::CTqovixAudioLevelInformationVisitor()
    : CTqovixMakerBlockVisitor(TqovixAtom::kOP02, eTqovixNoAudioLevel)
{
}
