// Export macro of the TarnFoundation shared library (hidden by default).
#pragma once

#define TARNFOUNDATION_API __attribute__((visibility("default")))
