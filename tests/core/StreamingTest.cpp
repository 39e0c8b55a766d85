// Indentation that streams carry.
#include "GeometryVolume/core/Streaming.h"

#include <gtest/gtest.h>

#include <set>
#include <sstream>

using namespace VLN::Streaming;

// requirement
TEST(Streaming, UnconfiguredStreamsHaveNoPad) {
  std::ostringstream os;
  Ostil::String out = "old";
  currentPad(os, out);
  EXPECT_EQ(out, "");
  incPad(os, out);
  EXPECT_EQ(out, "") << "pad width 0";
  EXPECT_FALSE(dumpRef(os));
  DumpInfo info;
  getDumpInfo(os, info);
  EXPECT_EQ(info.indent, 1);
  EXPECT_EQ(info.padWidth, 0);
  EXPECT_EQ(info.third, 0);
  EXPECT_FALSE(info.dumpRef);
  EXPECT_EQ(info.pad, "");
}

// boundary
TEST(Streaming, IncPadMultipliesIndentAndWidth) {
  std::ostringstream os;
  setPadWidth(os, 2);
  incIndent(os, 1);
  Ostil::String out;
  incPad(os, out);
  EXPECT_EQ(out, "    ");
  currentPad(os, out);
  EXPECT_EQ(out, "    ");
  decPad(os, out);
  EXPECT_EQ(out, "  ");
}

// boundary
TEST(Streaming, IndentNeverFallsBelowZero) {
  std::ostringstream os;
  setPadWidth(os, 3);
  Ostil::String out = "x";
  decPad(os, out);
  EXPECT_EQ(out, "");
  DumpInfo info;
  getDumpInfo(os, info);
  EXPECT_EQ(info.indent, 0);
  incIndent(os, 3);
  decIndent(os, 5);
  getDumpInfo(os, info);
  EXPECT_EQ(info.indent, 0);
  incIndent(os, 3);
  decIndent(os, 2);
  getDumpInfo(os, info);
  EXPECT_EQ(info.indent, 1);
  decIndent(os, 1);
  getDumpInfo(os, info);
  EXPECT_EQ(info.indent, 0);
}

// requirement: each of the four slots is read from the stream
TEST(Streaming, DumpInfoReadsTheSlots) {
  IndexInfo index;
  getIndexInfo(index);
  EXPECT_EQ((std::set<int>{index.indent, index.padWidth, index.third, index.dumpRef}).size(), 4u);
  std::ostringstream os;
  os.iword(index.indent) = 2;
  os.iword(index.padWidth) = 3;
  os.iword(index.third) = 41;
  setDumpRef(os, true);
  EXPECT_EQ(os.iword(index.dumpRef), 1);
  EXPECT_TRUE(dumpRef(os));
  DumpInfo info;
  getDumpInfo(os, info);
  EXPECT_EQ(info.pad, "      ");
  EXPECT_EQ(info.indent, 2);
  EXPECT_EQ(info.padWidth, 3);
  EXPECT_EQ(info.third, 41);
  EXPECT_TRUE(info.dumpRef);
  os.iword(index.dumpRef) = 2;
  EXPECT_FALSE(dumpRef(os)) << "holds for 1 alone";
  setDumpRef(os, false);
  EXPECT_EQ(os.iword(index.dumpRef), 0);
}

// requirement: state belongs to the stream
TEST(Streaming, StreamsDoNotShareTheirIndent) {
  std::ostringstream a, b;
  setPadWidth(a, 1);
  setPadWidth(b, 1);
  incIndent(a, 4);
  EXPECT_EQ(pad(a), "    ");
  EXPECT_EQ(pad(b), "");
}
