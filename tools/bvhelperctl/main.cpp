// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "tools/bvhelperctl/CommandLine.h"

int main(int argc, char** argv) { return brenvik::tools::runCommandLine(argc, argv); }
