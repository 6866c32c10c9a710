// The groups of measurements. Each enters its rows into the report.
#pragma once

#include "Report.h"

void measureProcesses(Report& report);    // start-up, idling, the end
void measurePictures(Report& report);     // from the first delivery to the file
void measureFrameReader(Report& report);  // bytes to messages
void measureCodec(Report& report);        // elements to bytes and back
void measureSdkSide(Report& report);      // callbacks across threads, polling
void measureTask(Report& report);         // frames out, idle passes
