// The cell pool: refused sizes, growth by blocks, damaged pools ending the process
// with their diagnostics; the SQL descriptor snapshot's layout and printout.
#include "common/util/cellpool.h"

#include <gtest/gtest.h>

#include <climits>
#include <cstring>
#include <string>

#include "common/util/sqlda.h"
#include "tests/testing/klptest.h"

TEST(QuickCell, RefusesSizesThatCannotHoldTheLinks) {
  struct Row { int32_t cellSize, cellsPerBlock; int rc; };
  const Row rows[] = {{8, 2, 0}, {12, 3, 0}, {7, 4, 2002}, {8, 1, 2002}, {-8, 4, 2002},
                      {INT32_MAX / 2, 4, 2002}};
  for (const Row& r : rows) {
    int rc = -1;
    quickCell pool(r.cellSize, r.cellsPerBlock, &rc);
    EXPECT_EQ(rc, r.rc) << r.cellSize << "x" << r.cellsPerBlock;
    void* cell = pool.getCell();
    EXPECT_EQ(cell != nullptr, r.rc == 0);
    if (cell) memset(cell, 0x5A, static_cast<size_t>(r.cellSize));  // the whole cell is ours
  }
}

TEST(QuickCell, GrowsByBlocksAndReusesReleasedCells) {
  quickCell pool(12, 4);  // unaligned cells
  void* first = pool.getCell();
  EXPECT_EQ(pool.numBlocks(), 1);
  EXPECT_EQ(pool.numCellsUsed(), 1);
  EXPECT_EQ(pool.numCellsFree(), 3);
  void* cells[8];
  for (void*& c : cells) memset(c = pool.getCell(), 0x33, 12);
  EXPECT_EQ(pool.numBlocks(), 3);
  EXPECT_EQ(pool.numCellsFree(), 3);
  EXPECT_EQ(pool.releaseMem(first), 0);
  EXPECT_EQ(pool.getCell(), first);
  EXPECT_EQ(pool.numBlocks(), 3);
  EXPECT_EQ(pool.releaseMem(nullptr), 2002);
  quickCell empty(8, 2);
  EXPECT_EQ(empty.releaseMem(first), 2002);  // nothing was handed out
}

TEST(QuickCell, DamagedPoolsEndTheProcessWithDiagnostics) {
  struct Row { const char* what; void (*damage)(quickCell&); const char* lines[3]; };
  const Row rows[] = {
      {"new block after the eye-catcher was overwritten",
       [](quickCell& p) {
         memcpy(reinterpret_cast<char*>(&p), "XXXX", 4);
         p.getCell();
       },
       {"quickCell::releaseMem()- ERROR!! :BAD QUICKCELL - did not find expected eye-catcher "
        "\"KLPQUICKCELL:  \"",
        "PRINTCELLS (quickCell::releaseMem():BAD numCellsUsed!!) : (threadId=",
        "quickCell::printCells()- ERROR!! :BAD QUICKCELL - did not find expected eye-catcher "
        "\"KLPQUICKCELL:  \" - Found \"XXXXUICKCELL:  \""}},
      {"release into a damaged pool",
       [](quickCell& p) {
         void* c = p.getCell();
         memcpy(reinterpret_cast<char*>(&p), "XXXX", 4);
         p.releaseMem(c);
       },
       {"did not find expected eye-catcher \"KLPQUICKCELL:  \"",
        "numBlocks=1, numCellsUsed=1, numCellsFree=3]", "Found \"XXXXUICKCELL:  \""}},
      {"a storage pool", [](quickCell&) {
         int marker = 0;
         quickCell p(8, 4, nullptr, &marker);
         if (p.getCell() != nullptr) exit(3);
       },
       {"quickCell::newBlock- ERROR!! :storage pool not supported",
        "quickCell::~quickCell- ERROR!! :storage pool support not implemented", ""}},
  };
  klptest::TmpDir dir;
  for (const Row& r : rows) {
    auto c = klptest::inChild(dir.path(), [&] {
      quickCell pool(16, 4);
      r.damage(pool);
      return 0;
    });
    EXPECT_TRUE(c.exited) << r.what;
    EXPECT_EQ(c.exitCode, 255) << r.what << "\n" << c.out;
    for (const char* line : r.lines)
      EXPECT_NE(c.out.find(line), std::string::npos) << r.what << ": " << line << "\n" << c.out;
  }
}

TEST(SnapDA, LayoutPrintoutAndRefusals) {
  sqlda* da = nullptr;
  const uint32_t types[3] = {0x01C4000A, 0x01F00004, 0x01810020};
  ASSERT_EQ(snapDAAllocTyped(&da, 3, types), 3);  // the header's fields show in the printout
  EXPECT_EQ(da->sqlvar[2].sqltype, 385);
  EXPECT_EQ(da->sqlvar[2].sqllen, 32);
  klptest::TmpDir dir;
  auto c = klptest::inChild(dir.path(), [&] {
    snapDAPrint(&da);
    return 0;
  });
  EXPECT_NE(c.out.find(": sqldaid='SQLDA   '; sqldabc= 184; sqln=   3; sqld=   3\n"),
            std::string::npos) << c.out;
  EXPECT_NE(c.out.find("   [ 0] sqltype=452; sqllen= 10; sqldata=0000000000000000; "
                       "sqlind=0000000000000000\n   [ 1] sqltype=496; sqllen=  4;"),
            std::string::npos) << c.out;
  snapDAFree(&da);
  EXPECT_EQ(da, nullptr);
  for (int n : {-1, 32768}) {
    EXPECT_EQ(snapDAAlloc(&da, n), 2002);
    EXPECT_EQ(da, nullptr);
    EXPECT_EQ(snapDAAllocTyped(&da, n, types), -1);
  }
  ASSERT_EQ(snapDAAlloc(&da, 0), 0);
  EXPECT_EQ(da->sqldabc, 16);
  snapDAFree(&da);
}
