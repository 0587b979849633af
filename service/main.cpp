#include "service.h"

int main() { return qvese_service_main(); }
