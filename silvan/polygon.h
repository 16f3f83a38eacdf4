// The footprint polygon.
#pragma once
