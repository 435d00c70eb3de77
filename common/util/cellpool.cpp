// The cell pool. Every free cell and every block begins with the link to the
// next one; links are copied with memcpy because a cell size that is no
// multiple of 8 leaves cells unaligned.
#include "common/util/cellpool.h"

#include <cinttypes>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "common/platform/hsv.h"
#include "common/util/klprc.h"

namespace {

constexpr int32_t kLinkSize = 8;

void* linkOf(const void* p) {
  void* next;
  memcpy(&next, p, sizeof next);
  return next;
}

void setLink(void* p, void* next) { memcpy(p, &next, sizeof next); }

}  // namespace

quickCell::quickCell(int32_t cellSize, int32_t cellsPerBlock, int* rc, void* storagePool)
    : cellSize_(cellSize), blockSize_(0), cellsPerBlock_(cellsPerBlock), storagePool_(storagePool) {
  memcpy(eyeCatcher_, QUICKCELL_EYECATCHER, sizeof eyeCatcher_);
  bool ok = cellSize >= kLinkSize && cellsPerBlock >= 2 &&
            cellsPerBlock <= (INT32_MAX - kLinkSize) / cellSize;
  if (ok) {
    blockSize_ = kLinkSize + cellsPerBlock * cellSize;
  } else {
    cellsPerBlock_ = 0;  // hands out nothing
  }
  if (rc) *rc = ok ? 0 : KLP_RC_BAD_PARM;
}

quickCell::~quickCell() {
  if (storagePool_) {
    printf("quickCell::~quickCell- ERROR!! :storage pool support not implemented\n");
    fflush(nullptr);
    exit(-1);
  }
  while (firstBlock_) {
    void* next = linkOf(firstBlock_);
    free(firstBlock_);
    firstBlock_ = next;
    --numBlocks_;
  }
}

void quickCell::checkEyeCatcher() {
  if (memcmp(eyeCatcher_, QUICKCELL_EYECATCHER, 15) == 0) return;
  printf("quickCell::releaseMem()- ERROR!! :BAD QUICKCELL - did not find expected eye-catcher "
         "\"%s\"\n", QUICKCELL_EYECATCHER);
  printCells("quickCell::releaseMem():BAD numCellsUsed!!");
  fflush(nullptr);
  exit(-1);
}

void* quickCell::newBlock() {
  checkEyeCatcher();
  if (storagePool_) {
    printf("quickCell::newBlock- ERROR!! :storage pool not supported\n");
    return nullptr;
  }
  if (cellsPerBlock_ < 2) return nullptr;
  char* block = static_cast<char*>(malloc(static_cast<size_t>(blockSize_)));
  if (!block) return nullptr;
  setLink(block, firstBlock_);
  firstBlock_ = block;
  ++numBlocks_;
  char* cells = block + kLinkSize;
  for (int32_t i = 1; i < cellsPerBlock_; ++i)
    setLink(cells + i * cellSize_, i + 1 < cellsPerBlock_ ? cells + (i + 1) * cellSize_ : nullptr);
  nextFree_ = cells + cellSize_;
  ++numCellsUsed_;
  return cells;
}

void* quickCell::getCell() {
  if (!nextFree_) return newBlock();
  checkEyeCatcher();
  void* cell = nextFree_;
  nextFree_ = linkOf(cell);
  ++numCellsUsed_;
  return cell;
}

int quickCell::releaseMem(void* cell) {
  checkEyeCatcher();
  if (!cell || numCellsUsed_ <= 0) return KLP_RC_BAD_PARM;
  setLink(cell, nextFree_);
  nextFree_ = cell;
  --numCellsUsed_;
  return 0;
}

void quickCell::printCells(const char* title) {
  printf("PRINTCELLS (%s) : (threadId=%lu) [cellSize=%d, blockSize=%d, cellsPerBlock=%d, "
         "nextFree=%p, firstBlock=%p, numBlocks=%d, numCellsUsed=%d, numCellsFree=%d]\n",
         title ? title : "", static_cast<unsigned long>(hsvThreadID()), cellSize_, blockSize_,
         cellsPerBlock_, nextFree_, firstBlock_, numBlocks_, numCellsUsed_, numCellsFree());
  selfCheck();
}

void quickCell::selfCheck() {
  if (memcmp(eyeCatcher_, QUICKCELL_EYECATCHER, sizeof eyeCatcher_) != 0) {
    char found[sizeof eyeCatcher_ + 1];
    memcpy(found, eyeCatcher_, sizeof eyeCatcher_);
    found[sizeof eyeCatcher_] = '\0';
    printf("quickCell::printCells()- ERROR!! :BAD QUICKCELL - did not find expected eye-catcher "
           "\"%s\" - Found \"%s\"\n", QUICKCELL_EYECATCHER, found);
  }
  // The chains are counted no further than the counts allow, so a loop in a
  // damaged chain still ends.
  int32_t blocks = 0;
  for (void* b = firstBlock_; b && blocks <= numBlocks_; b = linkOf(b)) ++blocks;
  if (blocks != numBlocks_)
    printf(" quickCell::printCells()- ERROR!! :BAD QUICKCELL - found %d blocks chained but "
           "numBlocks=%d.\n", blocks, numBlocks_);
  int32_t freeCells = 0;
  int32_t expected = numCellsFree();
  for (void* c = nextFree_; c && freeCells <= expected; c = linkOf(c)) ++freeCells;
  if (freeCells != expected)
    printf("quickCell::printCells()- ERROR!! :BAD QUICKCELL - found %d cells chained in free list "
           "but numCellsFree=%d as numCellsUsed=%d\n", freeCells, expected, numCellsUsed_);
}
