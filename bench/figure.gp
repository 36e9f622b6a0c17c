# One plot of BENCHMARKS.md, drawn in the directory where a driver wrote
# <id>.dat and <id>.vars (see write_plot in harness.h):
#   gnuplot -e "id='timers_fire'; title='Timers: fire'" bench/figure.gp
load id.'.vars'
set terminal pngcairo size 900,540 noenhanced font ',10'
set output id.'.png'
set title title
set ylabel 'ns per operation (median)'
set grid
set key outside right
if (lines) {
    set xlabel xlabel
    if (logx) { set logscale x }
    set logscale y
    plot for [i=0:blocks-1] id.'.dat' index i using 1:2 with linespoints \
        lw real(word(widths, i+1)) dt int(word(dashes, i+1)) title columnheader(2)
} else {
    set style data histograms
    set style histogram cluster gap 1
    set style fill solid 0.8 border -1
    set xtics rotate by -20
    set yrange [0:*]
    plot for [c=2:columns+1] id.'.dat' using c:xtic(1) title columnheader
}
