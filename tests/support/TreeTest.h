// A fixture holding a parsed atom tree over a movie in a scratch file, and the tree written back.
#pragma once

#include <gtest/gtest.h>

#include <cstdint>
#include <string>
#include <vector>

#include "atom/CTqovixAtomControl.h"
#include "file/CTqovixFile.h"
#include "support/TestSupport.h"

namespace testsupport {

class TreeTest : public ::testing::Test {
protected:
    // A refused movie leaves the tree it had; a new file each time, as that tree may still point into the last one.
    eTqovixErrorCode Load(const std::vector<uint8_t>& movie);
    // Every top-level atom of the tree written to a new file, and that file's bytes.
    std::vector<uint8_t> WriteTree();
    // `file` reopened on a new scratch file holding `bytes` (mode 1) or created empty (mode 2).
    std::string Open(CTqovixFile& file, int mode, const std::vector<uint8_t>& bytes = {});

    TempDir m_dir;
    CTqovixFile m_file;
    CTqovixAtomControl m_tree;

private:
    int m_files = 0;
};

}  // namespace testsupport
