# The growth curves of the benchmarks, as one PNG.
#   gnuplot -e "dir='RUN_DIR'; out='FILE.png'" bench/plot.gp
# RUN_DIR holds convergence.dat, convergence-load.dat, codec_wine.dat and
# codec_native.dat, as vorbel_bench and codec_bench_native write them.
set terminal pngcairo size 1500,480 font "sans,10"
set output out
set multiplot layout 1,3
set logscale xy
set grid
set key top left
set xlabel "listeners N"

set title "Convergence: time until B holds all N"
set ylabel "ms"
plot dir."/convergence.dat" using 1:2 with linespoints lw 2 pt 7 lc 1 title "first registration in A -> B holds all, quiet", \
     dir."/convergence.dat" using 1:3 with linespoints lw 1 pt 5 lc 1 dt 2 title "last registration in A -> B holds all, quiet", \
     dir."/convergence-load.dat" using 1:2 with linespoints lw 2 pt 7 lc 2 title "first -> all, under load", \
     dir."/convergence-load.dat" using 1:3 with linespoints lw 1 pt 5 lc 2 dt 2 title "last -> all, under load"

set title "Bytes on vorbel\\_service for a burst of N registrations"
set ylabel "bytes"
plot dir."/convergence.dat" using 1:4 with linespoints lw 2 pt 7 lc 1 title "B received, quiet", \
     dir."/convergence-load.dat" using 1:4 with linespoints lw 2 pt 7 lc 2 title "B received, under load", \
     dir."/convergence.dat" using 1:5 with lines lw 1 lc 3 dt 2 title "the final table", \
     dir."/convergence.dat" using 1:($5*8) with lines lw 1 lc 4 dt 3 title "8 x the final table"

set title "Listeners message codec, per listener"
set ylabel "ns per listener"
set key top right
plot dir."/codec_wine.dat" using 1:2 with linespoints lw 2 pt 7 lc 1 title "encode, Wine", \
     dir."/codec_wine.dat" using 1:3 with linespoints lw 2 pt 7 lc 2 title "verify, Wine", \
     dir."/codec_wine.dat" using 1:4 with linespoints lw 2 pt 7 lc 3 title "decode, Wine", \
     dir."/codec_native.dat" using 1:2 with linespoints lw 1 pt 6 lc 1 dt 2 title "encode, native", \
     dir."/codec_native.dat" using 1:3 with linespoints lw 1 pt 6 lc 2 dt 2 title "verify, native", \
     dir."/codec_native.dat" using 1:4 with linespoints lw 1 pt 6 lc 3 dt 2 title "decode, native"
unset multiplot
