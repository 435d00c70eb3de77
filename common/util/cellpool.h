// The cell pool: fixed-size cells carved from larger blocks. Cells come and go
// in constant time without the allocator; blocks are only added, and all of
// them are freed with the pool. A pool has no lock: one thread owns it or its
// owner serialises access. A pool found damaged (its eye-catcher overwritten)
// is not survivable: diagnostics on standard output, then exit code -1.
#pragma once

#include <cstdint>

constexpr char QUICKCELL_EYECATCHER[16] = "KLPQUICKCELL:  ";

class quickCell {
 public:
  // rc (optional) gets 0, or 2002 when cellsPerBlock < 2, cellSize < 8 or a
  // block would not fit 31 bits; a refused pool hands out no cells. A
  // storage pool is not supported (newBlock refuses, destruction exits).
  quickCell(int32_t cellSize, int32_t cellsPerBlock, int* rc = nullptr,
            void* storagePool = nullptr);
  ~quickCell();
  quickCell(const quickCell&) = delete;
  quickCell& operator=(const quickCell&) = delete;

  // A cell: the head of the free list, else the first cell of a new block.
  // Null when memory runs out (the pool is unchanged).
  void* getCell();
  // Gives a cell back. 0, or 2002 for a null cell or when no cell is out.
  int releaseMem(void* cell);
  // Adds a block and answers its first cell (counted as used); the others
  // go on the free list. Null when memory runs out or a storage pool is set.
  void* newBlock();
  // The summary line, then the pool's self-checks.
  void printCells(const char* title);

  int32_t numCellsFree() const { return numBlocks_ * cellsPerBlock_ - numCellsUsed_; }
  int32_t numBlocks() const { return numBlocks_; }
  int32_t numCellsUsed() const { return numCellsUsed_; }

 private:
  void checkEyeCatcher();
  void selfCheck();

  // Fields in their record order; eyeCatcher_ stays first.
  char eyeCatcher_[16];
  int32_t cellSize_;
  int32_t blockSize_;
  int32_t cellsPerBlock_;
  void* storagePool_;
  void* nextFree_ = nullptr;
  void* firstBlock_ = nullptr;
  int32_t numBlocks_ = 0;
  int32_t numCellsUsed_ = 0;
};
