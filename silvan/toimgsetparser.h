// Filled in by a later change.
#pragma once
