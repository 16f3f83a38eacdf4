// Filled in by a later change.
