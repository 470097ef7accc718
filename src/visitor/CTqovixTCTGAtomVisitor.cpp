#include "visitor/CTqovixTCTGAtomVisitor.h"

#include <cstring>
#include <vector>

#include "atom/CTqovixLeafAtom.h"
#include "atom/CTqovixTCTGAtom.h"

namespace {

constexpr uint16_t kTagSoftwareName = 3;
constexpr uint16_t kTypeAscii = 2;

TCTG::TqovixTCTGTag SoftwareNameTag()
{
    TCTG::TqovixTCTGTag tag;
    tag.group = 0;
    tag.number = kTagSoftwareName;
    tag.type = kTypeAscii;
    tag.data.assign(TCTG::TCTG_SOFTWARE_NAME, TCTG::TCTG_SOFTWARE_NAME + sizeof TCTG::TCTG_SOFTWARE_NAME);
    tag.count = static_cast<uint16_t>(tag.data.size());
    return tag;
}

}  // namespace

CTqovixTCTGAtomVisitor::CTqovixTCTGAtomVisitor()
    : CTqovixPathTargetVisitor({TqovixAtom::kMoov, TqovixAtom::kUdta, TqovixAtom::kTCDT, TqovixAtom::kTCTG})
{
}

eTqovixErrorCode CTqovixTCTGAtomVisitor::Analyze(const TqovixAtomPath&, const CTqovixContainerAtom&) const
{
    return eTqovixErrorInternal;
}

eTqovixErrorCode CTqovixTCTGAtomVisitor::Analyze(const TqovixAtomPath&, const CTqovixLeafAtom&) const
{
    return eTqovixErrorInternal;
}

eTqovixErrorCode CTqovixTCTGAtomVisitor::Update(const TqovixAtomPath& path, CTqovixLeafAtom& atom) const
{
    if (!IsTarget(path) || atom.GetDataSize() == 0) {
        return eTqovixVisitSkip;
    }
    const uint8_t* payload = atom.GetData();
    if (payload == nullptr) {
        return eTqovixVisitSkip;  // unreadable: keep the stored tags rather than lose them
    }
    std::vector<uint8_t> output;
    output.reserve(atom.GetDataSize() + 27);
    bool softwareTagPlaced = false;
    CTqovixTCTGAtom tags(payload, atom.GetDataSize());
    while (tags.FindNextTag()) {
        if (tags.GetTagGroup() == 0 && tags.GetTagNumber() == kTagSoftwareName) {
            if (!softwareTagPlaced) {
                CTqovixTCTGAtom::AppendTag(output, SoftwareNameTag());
                softwareTagPlaced = true;
            }
            continue;
        }
        output.insert(output.end(), tags.GetTag(), tags.GetTag() + tags.GetTagSize());
    }
    if (!softwareTagPlaced) {
        CTqovixTCTGAtom::AppendTag(output, SoftwareNameTag());
    }
    atom.SetData(output.data(), output.size());
    return eTqovixSuccess;
}
