module tessel

go 1.19
