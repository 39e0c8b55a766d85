// The options of the commands, and what their declarations share.
#pragma once

#include "Interop/FileFormat.h"
#include "Interop/VdbFile.h"

namespace CLI {
class App;
class Option;
} // namespace CLI

namespace Vln {

void declareInfo(CLI::App& self);
void declareSlice(CLI::App& self);
void declareConvert(CLI::App& self);
void declareFlatten(CLI::App& self);
void declareValidate(CLI::App& self);
void declareProbe(CLI::App& self);
void declareMake(CLI::App& self);
void declareChurn(CLI::App& self);
void declareRender(CLI::App& self);
void declareView(CLI::App& self);
void declarePoints(CLI::App& self);
void declareTiles(CLI::App& self);
void declareAdvect(CLI::App& self);
void declareCompletions(CLI::App& self);
void declareManual(CLI::App& self);

/// "A .nvtt or .vdb file": of the formats that such content is read from, or "to write".
std::string inputFile(VLN::Interop::FileContent content);
std::string outputFile(VLN::Interop::FileContent content);
/// Refuses what is no finite number, for options that take doubles.
CLI::Option* finite(CLI::Option* option);
void addChannelFilter(CLI::App& self, VLN::Interop::VdbReadLimits& limits);
void addMemoryLimit(CLI::App& self, VLN::Interop::VdbReadLimits& limits);

} // namespace Vln
