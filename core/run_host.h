// The transist's host during a run: what the writer and reader ask of the
// controller and tell it.
#pragma once

#include "transist/transist.h"

class LogController;

// The host of controller's runs; one run at a time, so one host serves them all.
TransistHost* run_host(LogController* controller);
