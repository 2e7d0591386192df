// exceptops.h: exception location filters, stop lists and the per-frame exception records.
//
// The filter tables and the per-frame records land with the exception analysis; the
// records exist now so that the tracer state keeps its final shape and lifecycle calls.
#pragma once

struct ExcFilters {
  int initialised = 0;
};

struct ExcData {
  int initialised = 0;
};

void __tracer_init_exception_filters(ExcFilters* filters);
void __tracer_clear_exception_filters(ExcFilters* filters);
void init_exc_data(ExcData* data);
void reset_exc_data(ExcData* data);
