// sr_i_file_system.cpp - the default system calls behind Sr_File_System.

#include "sr_i_file_system.h"

#include <sys/stat.h>

const sr_i_file_system_calls_t Sr_Default_File_System = {::mkdir};
sr_i_file_system_calls_t Sr_File_System = Sr_Default_File_System;
