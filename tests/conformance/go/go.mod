module runner

go 1.19

require tessel v0.0.0

replace tessel => ../../../bindings/go
