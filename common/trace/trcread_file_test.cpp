// A trace file whose counters or record lengths claim more than the file
// holds: the reader refuses the record before it sizes any memory by it.
#include <gtest/gtest.h>

#include <cstdio>
#include <cstring>
#include <string>
#include <vector>

#include "common/trace/trcread.h"
#include "tests/testing/klptest.h"

namespace {

TEST(TraceFileRead, LengthsBeyondTheFileAreRefused) {
  struct Case {
    const char* name;
    uint32_t highWater;     // what the header claims is held
    uint32_t recordLength;  // what the one record claims
    size_t bytesWritten;    // of that record
    int error;
  };
  const Case cases[] = {
      {"sound record", 48, 48, 48, TRC_WALK_OK},
      {"counters and length of 2 GB over 48 bytes", 0x7FFFFFF0, 0x7FFFFFF0, 48,
       TRC_WALK_BAD_RECORD},
      {"record cut after its header", 80, 80, 40, TRC_WALK_BAD_RECORD},
      {"record header cut", 80, 80, 20, TRC_WALK_IO},
  };
  klptest::TmpDir dir;
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    std::vector<uint8_t> header(TRC_HEADER_SIZE, 0);
    auto* h = reinterpret_cast<trcBlockHeader*>(header.data());
    h->dataOffset = TRC_HEADER_SIZE;
    h->writeOffset = h->highWaterOffset = c.highWater;
    h->entryCount = 1;
    std::string path = dir.path() + "cut.trc";
    snprintf(h->fileName, sizeof h->fileName, "%s", path.c_str());
    std::vector<uint8_t> record(c.bytesWritten, 0);
    memcpy(record.data(), &c.recordLength, sizeof c.recordLength);
    FILE* f = fopen(path.c_str(), "wb");
    ASSERT_NE(nullptr, f);
    fwrite(header.data(), 1, header.size(), f);
    fwrite(record.data(), 1, record.size(), f);
    fclose(f);

    FILE* quiet = fopen("/dev/null", "w");
    g_trcAnchorStorage.out = quiet;
    trcIter it;
    trcIterInit(&it, h, 0, true);
    int records = 0;
    while (trcNextRecord(&it)) ++records;
    g_trcAnchorStorage.out = nullptr;
    fclose(quiet);
    EXPECT_EQ(c.error, it.error);
    EXPECT_EQ(c.error == TRC_WALK_OK ? 1 : 0, records);
  }
}

}  // namespace
