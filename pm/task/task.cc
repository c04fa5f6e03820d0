// The task object: TaskBase and Task.
