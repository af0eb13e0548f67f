#pragma once

#include "Utility/rndctl/tasks/rj_taskrec.h"

/// Copies the error lines of a failed task's output into its job's comment.
void Job_Error_Update(TASK* entry);
