#include "atom/CTqovixLeafAtom.h"

#include <algorithm>
#include <new>
#include <stdexcept>

#include "atom/CTqovixAtomVisitor.h"
#include "file/CTqovixFile.h"

namespace {

// The largest count one file read or write takes.
constexpr uint64_t kMaxPiece = 4294967295ULL;
// A payload larger than this goes from the source to the destination in pieces of this size
// (or inside the kernel) instead of being loaded: its size is the file's to choose.
constexpr uint64_t kStreamPiece = 1 << 20;

}  // namespace

CTqovixLeafAtom::CTqovixLeafAtom(eTqovixAtomType type, CTqovixFile* file, long long offset, uint64_t size,
                                 bool largeHeader)
    : m_type(type), m_pFile(file), m_offset(offset), m_size(size), m_bLargeHeader(largeHeader)
{
}

uint64_t CTqovixLeafAtom::GetDataSize() const
{
    return m_pFile != nullptr ? m_size : m_data.size();
}

uint64_t CTqovixLeafAtom::GetSize() const
{
    return SizeWithHeader(GetDataSize(), m_bLargeHeader);
}

eTqovixErrorCode CTqovixLeafAtom::CheckPayloadInFile() const
{
    // A size that the file cannot hold must not turn into an allocation or a long copy.
    long long fileSize = 0;
    const eTqovixErrorCode result = m_pFile->GetFileSize(&fileSize);
    if (TqovixFailed(result)) {
        return result;
    }
    if (m_offset < 0 || m_offset > fileSize || m_size > static_cast<uint64_t>(fileSize - m_offset)) {
        return eTqovixErrorInvalidMovie;
    }
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixLeafAtom::LoadData() const
{
    if (m_pFile == nullptr) {
        return eTqovixSuccess;
    }
    const uint64_t size = GetDataSize();
    if (size == 0) {
        return eTqovixSuccess;
    }
    eTqovixErrorCode result = CheckPayloadInFile();
    if (TqovixFailed(result)) {
        return result;
    }
    result = m_pFile->Seek(m_offset, CTqovixFile::eTqovixSeekBegin);
    if (TqovixFailed(result)) {
        return result;
    }

    std::vector<uint8_t> data;
    try {
        data.resize(size);
    } catch (const std::bad_alloc&) {
        return eTqovixErrorOutOfMemory;
    } catch (const std::length_error&) {
        return eTqovixErrorOutOfMemory;
    }
    for (uint64_t done = 0; done < size;) {
        const auto piece = static_cast<unsigned int>(std::min(kMaxPiece, size - done));
        unsigned int readSize = 0;
        result = m_pFile->Read(data.data() + done, &readSize, piece);
        if (TqovixFailed(result)) {
            return result;
        }
        if (readSize < piece) {
            return eTqovixErrorInvalidMovie;  // the file shrank under us
        }
        done += piece;
    }
    m_data = std::move(data);
    m_pFile = nullptr;
    return eTqovixSuccess;
}

const uint8_t* CTqovixLeafAtom::GetData() const
{
    const eTqovixErrorCode result = LoadData();
    if (TqovixFailed(result)) {
        m_loadFailure = result;
        return nullptr;
    }
    if (m_data.empty()) {
        return nullptr;
    }
    return m_data.data();
}

void CTqovixLeafAtom::SetData(const void* data, uint64_t size)
{
    m_pFile = nullptr;
    m_offset = 0;
    m_size = 0;
    if (data == nullptr || size == 0) {
        m_data.clear();
        return;
    }
    const auto* bytes = static_cast<const uint8_t*>(data);
    m_data.assign(bytes, bytes + size);
}

eTqovixErrorCode CTqovixLeafAtom::Analyze(CTqovixAtomVisitor& visitor, const TqovixAtomPath& path) const
{
    TqovixAtomPath leafPath = path;
    leafPath.push_back(m_type);
    m_loadFailure = eTqovixSuccess;
    const eTqovixErrorCode result = visitor.Analyze(leafPath, *this);
    return TqovixFailed(m_loadFailure) ? m_loadFailure : result;
}

eTqovixErrorCode CTqovixLeafAtom::Update(const CTqovixAtomVisitor& visitor, const TqovixAtomPath& path)
{
    TqovixAtomPath leafPath = path;
    leafPath.push_back(m_type);
    m_loadFailure = eTqovixSuccess;
    const eTqovixErrorCode result = visitor.Update(leafPath, *this);
    return TqovixFailed(m_loadFailure) ? m_loadFailure : result;
}

eTqovixErrorCode CTqovixLeafAtom::Write(CTqovixFile& file) const
{
    if (!file.IsOpened()) {
        return eTqovixErrorInternal;
    }
    if (m_pFile != nullptr && m_size > kStreamPiece) {
        return CopyPayload(file);
    }
    // Load before the header goes out, so an unreadable payload leaves nothing half-written.
    eTqovixErrorCode result = LoadData();
    if (TqovixFailed(result)) {
        return result;
    }
    result = WriteHeader(file, m_bLargeHeader);
    if (TqovixFailed(result)) {
        return result;
    }
    const uint64_t size = m_data.size();
    for (uint64_t done = 0; done < size;) {
        const auto piece = static_cast<unsigned int>(std::min(kMaxPiece, size - done));
        result = file.Write(m_data.data() + done, piece);
        if (TqovixFailed(result)) {
            return result;
        }
        done += piece;
    }
    return eTqovixSuccess;
}

eTqovixErrorCode CTqovixLeafAtom::CopyPayload(CTqovixFile& file) const
{
    eTqovixErrorCode result = CheckPayloadInFile();
    if (TqovixFailed(result)) {
        return result;
    }
    result = WriteHeader(file, m_bLargeHeader);
    if (!TqovixFailed(result)) {
        result = m_pFile->Seek(m_offset, CTqovixFile::eTqovixSeekBegin);
    }
    bool copied = false;
    if (!TqovixFailed(result)) {
        result = file.CopyFrom(*m_pFile, m_size, &copied);
    }
    if (TqovixFailed(result) || copied) {
        return result;
    }
    std::vector<uint8_t> piece;
    try {
        piece.resize(kStreamPiece);
    } catch (const std::bad_alloc&) {
        return eTqovixErrorOutOfMemory;
    }
    for (uint64_t done = 0; done < m_size;) {
        const auto size = static_cast<unsigned int>(std::min(kStreamPiece, m_size - done));
        unsigned int got = 0;
        result = m_pFile->Read(piece.data(), &got, size);
        if (TqovixFailed(result)) {
            return result;
        }
        if (got < size) {
            return eTqovixErrorInvalidMovie;  // the file shrank under us
        }
        result = file.Write(piece.data(), size);
        if (TqovixFailed(result)) {
            return result;
        }
        done += size;
    }
    return eTqovixSuccess;
}
