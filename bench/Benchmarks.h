// SPDX-License-Identifier: Apache-2.0
// The groups of figures. Each makes what it needs in a place of its own, and leaves nothing behind. Main thread.
#pragma once

#include "Daemon.h"
#include "Report.h"

#include <vector>

namespace zor::bench {

/// One client asks for a container that is there: LookupBench.cc.
std::vector<Figure> measureLookup(const Settings& settings);
/// The cost of entitlements to a request: RegistrationBench.cc.
std::vector<Figure> measureRegistration(const Settings& settings);
/// Many do: ThroughputBench.cc.
std::vector<Figure> measureThroughput(const Settings& settings);
/// The kernel's agent asks for the containers of a process: UpcallBench.cc.
std::vector<Figure> measureUpcall(const Settings& settings);
/// A program is started in its sandbox: RunBench.cc.
std::vector<Figure> measureRun(const Settings& settings);
/// Containers are made: CreateBench.cc.
std::vector<Figure> measureCreate(const Settings& settings);
/// The first look into a class with many containers: ClassBench.cc.
std::vector<Figure> measureClass(const Settings& settings);
/// The data-protection class of a container's content is changed: ProtectionBench.cc.
std::vector<Figure> measureProtection(const Settings& settings);
/// A container with many files is measured and removed: TreeBench.cc.
std::vector<Figure> measureTree(const Settings& settings);
/// A container takes another's place, and a bundle tells again what it takes: ReplaceBench.cc.
std::vector<Figure> measureReplace(const Settings& settings);
/// Lookups while containers with many files are removed and measured: BusyBench.cc.
std::vector<Figure> measureBusy(const Settings& settings);
/// Lookups while others make, register, replace, wipe and delete: BesideBench.cc.
std::vector<Figure> measureBeside(const Settings& settings);
/// A directory becomes the content of a container: InstallBench.cc.
std::vector<Figure> measureInstall(const Settings& settings);
/// The first launch after a boot: BootBench.cc.
std::vector<Figure> measureBoot(const Settings& settings);
/// The daemon's cost when nobody asks, and until it answers: LifeBench.cc.
std::vector<Figure> measureStart(const Settings& settings);
/// Its cost after it was asked very often: LifeBench.cc.
std::vector<Figure> measureEndurance(const Settings& settings);

} // namespace zor::bench
