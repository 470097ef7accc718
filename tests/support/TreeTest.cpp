#include "support/TreeTest.h"

namespace testsupport {

std::string TreeTest::Open(CTqovixFile& file, int mode, const std::vector<uint8_t>& bytes)
{
    const std::string path = m_dir.File("movie" + std::to_string(m_files++) + ".mov");
    file.Close();
    EXPECT_TRUE(mode == 2 || WriteFile(path, bytes));
    EXPECT_EQ(file.Open(path.c_str(), mode), eTqovixSuccess);
    return path;
}

eTqovixErrorCode TreeTest::Load(const std::vector<uint8_t>& movie)
{
    Open(m_file, 1, movie);
    return m_tree.Initialize(m_file);
}

std::vector<uint8_t> TreeTest::WriteTree()
{
    TqovixAtomList atoms;
    m_tree.GetAtoms(atoms);
    CTqovixFile out;
    const std::string path = Open(out, 2);
    for (const auto& atom : atoms) {
        EXPECT_EQ(atom->Write(out), eTqovixSuccess);
    }
    out.Close();
    return ReadFile(path);
}

}  // namespace testsupport
