// exceptops.cpp: exception filters and per-frame records (see exceptops.h).
#include "exc/exceptops.h"

void __tracer_init_exception_filters(ExcFilters* filters) {
  filters->initialised = 1;
}
void __tracer_clear_exception_filters(ExcFilters* filters) {
  filters->initialised = 1;
}
void init_exc_data(ExcData* data) {
  data->initialised = 1;
}
void reset_exc_data(ExcData* data) {
  data->initialised = 1;
}
