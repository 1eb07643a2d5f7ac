// WorkQueue
